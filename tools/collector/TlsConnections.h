// The open TLS connections of a server, so that stopping need not wait for idle ones to time out.
#pragma once

#include <openssl/ssl.h>

#include <set>

#include "platform/Lock.h"

namespace velk::collector {

/// Watches one SSL context: a connection is here from its handshake until OpenSSL frees it, which is before its
/// socket is closed. Outlives the context. Any thread.
class TlsConnections {
 public:
  void watch(SSL_CTX* context);
  /// Ends the reading side of every connection, now and from now on: what is being answered still goes out, the
  /// next request is not read.
  void endReading();

 private:
  static void handshakeStarted(const SSL* connection, int where, int result);
  static void freed(void* parent, void* pointer, CRYPTO_EX_DATA* data, int index, long argument, void* pointerArgument);
  static int connectionIndex();
  static int contextIndex();

  void add(const SSL* connection);
  void remove(const SSL* connection);

  Lock _lock;
  std::set<const SSL*> _connections VELK_GUARDED_BY(_lock);
  bool _ended VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk::collector
