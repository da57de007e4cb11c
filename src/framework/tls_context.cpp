#include "framework/tls_context.h"

#include <fcntl.h>
#include <openssl/x509.h>

#include <boost/asio/error.hpp>
#include <boost/asio/ssl/error.hpp>
#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "framework/unique_fd.h"

namespace Ipc {
namespace detail {
namespace {

namespace ssl = boost::asio::ssl;

// A path that cannot be opened at all fails as such, before OpenSSL would
// report it as a parsing problem.
void requireReadable(const char* role, const std::string& path) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    throw std::runtime_error(std::string("Cannot read the TLS ") + role + " \"" + path + "\": " + std::strerror(errno));
  }
}

std::runtime_error unusable(const char* role, const std::string& path, const std::string& why) {
  return std::runtime_error(std::string("The TLS ") + role + " \"" + path + "\" cannot be used: " + why);
}

}  // namespace

std::unique_ptr<ssl::context> makeServerTlsContext(const TlsFiles& files) {
  if (!files.enabled()) return nullptr;
  auto ctx = std::make_unique<ssl::context>(ssl::context::tls_server);
  ctx->set_options(ssl::context::default_workarounds | ssl::context::no_sslv2 | ssl::context::no_sslv3 |
                   ssl::context::no_tlsv1 | ssl::context::no_tlsv1_1 | ssl::context::no_compression |
                   ssl::context::single_dh_use);
  SSL_CTX* native = ctx->native_handle();
  SSL_CTX_set_min_proto_version(native, TLS1_2_VERSION);
  SSL_CTX_set_options(native, SSL_OP_CIPHER_SERVER_PREFERENCE | SSL_OP_NO_RENEGOTIATION);
  // An encrypted key would make OpenSSL ask for its pass phrase on the
  // terminal; without one it fails, and the start with it.
  ctx->set_password_callback([](std::size_t, ssl::context::password_purpose) { return std::string(); });

  boost::system::error_code ec;
  requireReadable("certificate file", files.certFile);
  ctx->use_certificate_chain_file(files.certFile, ec);
  if (ec) throw unusable("certificate file", files.certFile, ec.message());
  requireReadable("key file", files.keyFile);
  ctx->use_private_key_file(files.keyFile, ssl::context::pem, ec);
  if (ec) throw unusable("key file", files.keyFile, ec.message());
  if (SSL_CTX_check_private_key(native) != 1) {
    throw unusable("key file", files.keyFile, "it does not belong to the certificate in \"" + files.certFile + "\"");
  }

  if (files.mutual()) {
    requireReadable("client CA file", files.clientCaFile);
    ctx->load_verify_file(files.clientCaFile, ec);
    if (ec) throw unusable("client CA file", files.clientCaFile, ec.message());
    // The certificate request names the acceptable CAs, so that a client
    // with several certificates can pick the right one.
    STACK_OF(X509_NAME)* names = SSL_load_client_CA_file(files.clientCaFile.c_str());
    if (names == nullptr) throw unusable("client CA file", files.clientCaFile, "it holds no CA certificate");
    SSL_CTX_set_client_CA_list(native, names);  // takes the list
    ctx->set_verify_mode(ssl::verify_peer | ssl::verify_fail_if_no_peer_cert);
    // Sessions resumed under client verification must carry this context.
    static constexpr unsigned char kSessionContext[] = "cvdbserver";
    SSL_CTX_set_session_id_context(native, kSessionContext, sizeof kSessionContext - 1);
  }
  return ctx;
}

std::string tlsFailureText(const boost::system::error_code& ec, SSL* session) {
  if (ec == boost::asio::error::eof || ec == boost::asio::ssl::error::stream_truncated) {
    return "the peer closed the connection";
  }
  std::string text = ec.message();
  if (session != nullptr) {
    const long verify = SSL_get_verify_result(session);
    if (verify != X509_V_OK) text += " (" + std::string(X509_verify_cert_error_string(verify)) + ")";
  }
  return text;
}

}  // namespace detail

void checkTlsFiles(const TlsFiles& files) { static_cast<void>(detail::makeServerTlsContext(files)); }

}  // namespace Ipc
