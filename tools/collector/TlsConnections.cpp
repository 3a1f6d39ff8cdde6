#include "tools/collector/TlsConnections.h"

#include <httplib.h>

namespace velk::collector {
namespace {

void endReadingOf(const SSL* connection) {
  // Fails on a connection that the peer has ended: then there is nothing left to end.
  if (const int socket = SSL_get_fd(connection); socket >= 0) (void)::shutdown(socket, SHUT_RD);
}

}  // namespace

int TlsConnections::connectionIndex() {
  static const int index = SSL_get_ex_new_index(0, nullptr, nullptr, nullptr, &TlsConnections::freed);
  return index;
}

int TlsConnections::contextIndex() {
  static const int index = SSL_CTX_get_ex_new_index(0, nullptr, nullptr, nullptr, nullptr);
  return index;
}

void TlsConnections::watch(SSL_CTX* context) {
  (void)connectionIndex();
  SSL_CTX_set_ex_data(context, contextIndex(), this);
  SSL_CTX_set_info_callback(context, &TlsConnections::handshakeStarted);
}

void TlsConnections::handshakeStarted(const SSL* connection, int where, int /*result*/) {
  if ((where & SSL_CB_HANDSHAKE_START) == 0) return;
  auto* self = static_cast<TlsConnections*>(SSL_CTX_get_ex_data(SSL_get_SSL_CTX(connection), contextIndex()));
  if (self == nullptr || SSL_get_ex_data(connection, connectionIndex()) != nullptr) return;
  SSL_set_ex_data(const_cast<SSL*>(connection), connectionIndex(), self);
  self->add(connection);
}

void TlsConnections::freed(void* parent, void* pointer, CRYPTO_EX_DATA* /*data*/, int /*index*/, long /*argument*/,
                           void* /*pointerArgument*/) {
  if (pointer != nullptr) static_cast<TlsConnections*>(pointer)->remove(static_cast<const SSL*>(parent));
}

void TlsConnections::add(const SSL* connection) {
  Guard guard(_lock);
  _connections.insert(connection);
  if (_ended) endReadingOf(connection);
}

void TlsConnections::remove(const SSL* connection) {
  Guard guard(_lock);
  _connections.erase(connection);
}

void TlsConnections::endReading() {
  Guard guard(_lock);
  _ended = true;
  for (const SSL* connection : _connections) endReadingOf(connection);
}

}  // namespace velk::collector
