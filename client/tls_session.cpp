#include "client/tls_session.h"

#include <fcntl.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <stdexcept>

#include "client/errors.h"
#include "framework/unique_fd.h"

namespace cvdb {
namespace {

// Bytes handed to OpenSSL per call when sending: large contents go out in
// steps instead of being encrypted whole into memory first.
constexpr std::size_t kWriteStep = 64 * 1024;

struct CtxFree {
  void operator()(SSL_CTX* c) const noexcept { SSL_CTX_free(c); }
};
struct SslFree {
  void operator()(SSL* s) const noexcept { SSL_free(s); }
};

// A failure of the socket under the session; the caller decides whether
// it means "cannot connect" or "connection lost".
class IoProblem : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

int pollTimeout(std::chrono::milliseconds timeout) {
  if (timeout.count() <= 0) return -1;
  return static_cast<int>(std::min<std::chrono::milliseconds::rep>(timeout.count(), INT_MAX));
}

void waitFor(int fd, short events, std::chrono::milliseconds timeout) {
  pollfd p{fd, events, 0};
  int r;
  do {
    r = ::poll(&p, 1, pollTimeout(timeout));
  } while (r < 0 && errno == EINTR);
  if (r == 0) throw IoProblem("no progress for " + std::to_string(timeout.count()) + " ms");
  if (r < 0) throw IoProblem(std::strerror(errno));
}

// OpenSSL's queued reasons as one text; empties the queue.
std::string openSslErrors() {
  std::string text;
  while (const unsigned long e = ERR_get_error()) {
    const char* reason = ERR_reason_error_string(e);
    if (!text.empty()) text += "; ";
    text += reason ? reason : "error " + std::to_string(e);
  }
  return text.empty() ? "the connection broke" : text;
}

void requireReadable(const char* role, const std::string& path) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid())
    throw ConnectFailed(std::string("cannot read the ") + role + " \"" + path + "\": " + std::strerror(errno));
}

// A key with a pass phrase fails instead of prompting on the terminal.
int noPassword(char*, int, int, void*) { return 0; }

}  // namespace

struct TlsSession::State {
  int fd = -1;
  std::unique_ptr<SSL_CTX, CtxFree> ctx;
  std::unique_ptr<SSL, SslFree> ssl;
  BIO* in = nullptr;   // from the server; owned by ssl
  BIO* out = nullptr;  // to the server; owned by ssl

  // Sends everything OpenSSL has produced.
  void flush(std::chrono::milliseconds timeout) {
    char buffer[16 * 1024];
    while (BIO_ctrl_pending(out) > 0) {
      const int n = BIO_read(out, buffer, sizeof buffer);
      if (n <= 0) return;
      const char* p = buffer;
      std::size_t left = static_cast<std::size_t>(n);
      while (left > 0) {
        const ssize_t sent = ::send(fd, p, left, MSG_NOSIGNAL);
        if (sent > 0) {
          p += sent;
          left -= static_cast<std::size_t>(sent);
        } else if (sent < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
          waitFor(fd, POLLOUT, timeout);
        } else if (sent < 0 && errno != EINTR) {
          throw IoProblem(std::strerror(errno));
        }
      }
    }
  }

  // Hands OpenSSL what the server sent; false when the server has closed.
  bool fill(std::chrono::milliseconds timeout) {
    char buffer[16 * 1024];
    while (true) {
      const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
      if (n > 0) {
        BIO_write(in, buffer, static_cast<int>(n));
        return true;
      }
      if (n == 0) return false;
      if (errno == EAGAIN || errno == EWOULDBLOCK) {
        waitFor(fd, POLLIN, timeout);
      } else if (errno != EINTR) {
        throw IoProblem(std::strerror(errno));
      }
    }
  }

  // Why the session failed, with the reason the server's certificate was
  // refused when it was.
  std::string failure() {
    std::string text = openSslErrors();
    const long verify = SSL_get_verify_result(ssl.get());
    if (verify != X509_V_OK) text += " (" + std::string(X509_verify_cert_error_string(verify)) + ")";
    return text;
  }
};

TlsSession::TlsSession(int fd, const std::string& host, const TlsOptions& options, std::chrono::milliseconds timeout)
    : s_(std::make_unique<State>()) {
  s_->fd = fd;
  ERR_clear_error();
  s_->ctx.reset(SSL_CTX_new(TLS_client_method()));
  if (!s_->ctx) throw ConnectFailed("cannot set up TLS: " + openSslErrors());
  SSL_CTX* ctx = s_->ctx.get();
  SSL_CTX_set_min_proto_version(ctx, TLS1_2_VERSION);
  SSL_CTX_set_options(ctx, SSL_OP_NO_COMPRESSION);
  SSL_CTX_set_verify(ctx, SSL_VERIFY_PEER, nullptr);
  SSL_CTX_set_default_passwd_cb(ctx, &noPassword);
  if (!options.caFile.empty()) {
    requireReadable("CA file", options.caFile);
    if (SSL_CTX_load_verify_locations(ctx, options.caFile.c_str(), nullptr) != 1) {
      throw ConnectFailed("cannot use the CA file \"" + options.caFile + "\": " + openSslErrors());
    }
  } else if (SSL_CTX_set_default_verify_paths(ctx) != 1) {
    throw ConnectFailed("cannot use the system's trusted CAs: " + openSslErrors());
  }
  if (options.certFile.empty() != options.keyFile.empty()) {
    throw ConnectFailed("a client certificate needs its key, and a key its certificate");
  }
  if (!options.certFile.empty()) {
    requireReadable("certificate file", options.certFile);
    requireReadable("key file", options.keyFile);
    if (SSL_CTX_use_certificate_chain_file(ctx, options.certFile.c_str()) != 1) {
      throw ConnectFailed("cannot use the certificate file \"" + options.certFile + "\": " + openSslErrors());
    }
    if (SSL_CTX_use_PrivateKey_file(ctx, options.keyFile.c_str(), SSL_FILETYPE_PEM) != 1 ||
        SSL_CTX_check_private_key(ctx) != 1) {
      throw ConnectFailed("cannot use the key file \"" + options.keyFile + "\": " + openSslErrors());
    }
  }

  s_->ssl.reset(SSL_new(ctx));
  s_->in = BIO_new(BIO_s_mem());
  s_->out = BIO_new(BIO_s_mem());
  if (!s_->ssl || !s_->in || !s_->out) {
    BIO_free(s_->in);
    BIO_free(s_->out);
    throw ConnectFailed("cannot set up TLS: " + openSslErrors());
  }
  SSL* ssl = s_->ssl.get();
  SSL_set_bio(ssl, s_->in, s_->out);
  // The server's certificate must name what the client asked for: an
  // address among its IP addresses, a name among its DNS names.
  const std::string& name = options.serverName.empty() ? host : options.serverName;
  X509_VERIFY_PARAM* param = SSL_get0_param(ssl);
  if (X509_VERIFY_PARAM_set1_ip_asc(param, name.c_str()) != 1) {
    SSL_set_hostflags(ssl, X509_CHECK_FLAG_NO_PARTIAL_WILDCARDS);
    // SNI (SSL_set_tlsext_host_name, a macro with a C cast).
    if (SSL_set1_host(ssl, name.c_str()) != 1 ||
        SSL_ctrl(ssl, SSL_CTRL_SET_TLSEXT_HOSTNAME, TLSEXT_NAMETYPE_host_name, const_cast<char*>(name.c_str())) != 1) {
      throw ConnectFailed("cannot check the server's name \"" + name + "\": " + openSslErrors());
    }
  }
  SSL_set_connect_state(ssl);

  const std::string prefix = "TLS handshake with " + host + " failed: ";
  while (true) {
    ERR_clear_error();
    const int r = SSL_connect(ssl);
    const int err = r == 1 ? SSL_ERROR_NONE : SSL_get_error(ssl, r);
    const bool fatal = err != SSL_ERROR_NONE && err != SSL_ERROR_WANT_READ;
    const std::string why = fatal ? s_->failure() : std::string();
    try {
      // A failed handshake still sends its alert: the server learns why.
      s_->flush(timeout);
      if (fatal) throw ConnectFailed(prefix + why);
      if (err == SSL_ERROR_NONE) return;
      if (!s_->fill(timeout)) throw ConnectFailed(prefix + "the server closed the connection");
    } catch (const IoProblem& e) {
      throw ConnectFailed(prefix + (fatal ? why : e.what()));
    }
  }
}

TlsSession::~TlsSession() = default;

void TlsSession::write(const void* data, std::size_t size, std::chrono::milliseconds timeout) {
  const auto* p = static_cast<const unsigned char*>(data);
  try {
    while (size > 0) {
      ERR_clear_error();
      const int r = SSL_write(s_->ssl.get(), p, static_cast<int>(std::min(size, kWriteStep)));
      if (r <= 0) {
        const int err = SSL_get_error(s_->ssl.get(), r);
        if (err != SSL_ERROR_WANT_READ) throw ConnectionEnded("TLS: " + s_->failure(), false);
        s_->flush(timeout);
        if (!s_->fill(timeout)) throw ConnectionEnded("the server closed the connection", false);
        continue;
      }
      p += r;
      size -= static_cast<std::size_t>(r);
      s_->flush(timeout);
    }
  } catch (const IoProblem& e) {
    throw ConnectionEnded(e.what(), false);
  }
}

std::size_t TlsSession::read(void* out, std::size_t size, std::chrono::milliseconds timeout) {
  try {
    while (true) {
      ERR_clear_error();
      const int r = SSL_read(s_->ssl.get(), out, static_cast<int>(std::min<std::size_t>(size, INT_MAX)));
      const int err = r > 0 ? SSL_ERROR_NONE : SSL_get_error(s_->ssl.get(), r);
      if (err == SSL_ERROR_SSL || err == SSL_ERROR_SYSCALL) {
        // The server's alert (a refused client certificate) says why.
        throw ConnectionEnded("TLS: " + s_->failure(), false);
      }
      // Reading may have produced an answer of the session's own (a key
      // update).
      s_->flush(timeout);
      if (r > 0) return static_cast<std::size_t>(r);
      if (err == SSL_ERROR_ZERO_RETURN) return 0;
      if (!s_->fill(timeout)) return 0;
    }
  } catch (const IoProblem& e) {
    throw ConnectionEnded(e.what(), false);
  }
}

void TlsSession::close() noexcept {
  SSL* ssl = s_->ssl.get();
  if (!ssl || !SSL_is_init_finished(ssl)) return;
  ERR_clear_error();
  SSL_shutdown(ssl);
  char buffer[256];
  const int n = BIO_read(s_->out, buffer, sizeof buffer);
  if (n > 0) static_cast<void>(::send(s_->fd, buffer, static_cast<std::size_t>(n), MSG_NOSIGNAL | MSG_DONTWAIT));
  ERR_clear_error();
}

}  // namespace cvdb
