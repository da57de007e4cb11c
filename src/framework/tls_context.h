#pragma once
// Internal to the transport: the OpenSSL context of the client port, built
// once from the TLS files and shared by every connection.
//
// TLS 1.2 at least, no compression, no renegotiation, the server's cipher
// order preferred; with a client CA file, a client must present a
// certificate that chains to it, or the handshake fails.
// Failures: makeServerTlsContext throws std::runtime_error naming the file
// that cannot be used.

#include <openssl/ssl.h>

#include <boost/asio/ssl/context.hpp>
#include <boost/system/error_code.hpp>
#include <memory>
#include <string>

#include "framework/tls_files.h"

namespace Ipc::detail {

std::unique_ptr<boost::asio::ssl::context> makeServerTlsContext(const TlsFiles& files);

// OpenSSL's reason for a failed handshake or TLS read, with the reason a
// peer's certificate was refused when there is one.
std::string tlsFailureText(const boost::system::error_code& ec, SSL* session);

}  // namespace Ipc::detail
