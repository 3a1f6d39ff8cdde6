// A certificate for loopback and the authority that signed it, made for one run.
#pragma once

#include <openssl/ssl.h>

#include <memory>
#include <string>

namespace velk::bench {

struct ContextFreer {
  void operator()(SSL_CTX* context) const { SSL_CTX_free(context); }
};
using ServerContext = std::unique_ptr<SSL_CTX, ContextFreer>;

/// A server's TLS context; the authority's certificate is written to `caFile`. Ends the program when that fails.
[[nodiscard]] ServerContext makeServerContext(const std::string& caFile);

}  // namespace velk::bench
