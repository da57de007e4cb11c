#include "support/test_certs.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <cstdio>
#include <memory>
#include <stdexcept>

namespace testing_support {
namespace {

constexpr long kDay = 24 * 60 * 60;

struct KeyFree {
  void operator()(EVP_PKEY* k) const noexcept { EVP_PKEY_free(k); }
};
struct CertFree {
  void operator()(X509* c) const noexcept { X509_free(c); }
};
struct FileClose {
  void operator()(std::FILE* f) const noexcept { std::fclose(f); }
};
using Key = std::unique_ptr<EVP_PKEY, KeyFree>;
using Cert = std::unique_ptr<X509, CertFree>;

[[noreturn]] void failed(const std::string& what) {
  const unsigned long e = ERR_get_error();
  const char* reason = e != 0 ? ERR_reason_error_string(e) : nullptr;
  throw std::runtime_error("test certificates: " + what + ": " + (reason ? reason : "unknown error"));
}

Key newKey() {
  Key key(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
  if (!key) failed("key generation");
  return key;
}

void addExtension(X509* cert, X509V3_CTX& ctx, int nid, const std::string& value) {
  X509_EXTENSION* ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value.c_str());
  if (ext == nullptr) failed("extension " + value);
  const int ok = X509_add_ext(cert, ext, -1);
  X509_EXTENSION_free(ext);
  if (ok != 1) failed("extension " + value);
}

enum class Use { Ca, Server, Client };

// A certificate for key, signed by issuer (itself when null), valid from
// from to until (seconds from now).
Cert makeCert(const std::string& commonName, EVP_PKEY* key, X509* issuer, EVP_PKEY* issuerKey, Use use, long from,
              long until) {
  static long serial = 1;
  Cert cert(X509_new());
  if (!cert) failed("certificate");
  X509* x = cert.get();
  X509_set_version(x, 2);
  ASN1_INTEGER_set(X509_get_serialNumber(x), serial++);
  X509_gmtime_adj(X509_getm_notBefore(x), from);
  X509_gmtime_adj(X509_getm_notAfter(x), until);
  X509_set_pubkey(x, key);
  X509_NAME* name = X509_get_subject_name(x);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>(commonName.c_str()), -1,
                             -1, 0);
  X509_set_issuer_name(x, issuer ? X509_get_subject_name(issuer) : name);
  X509V3_CTX ctx{};
  X509V3_set_ctx(&ctx, issuer ? issuer : x, x, nullptr, nullptr, 0);
  addExtension(x, ctx, NID_subject_key_identifier, "hash");
  addExtension(x, ctx, NID_authority_key_identifier, "keyid:always");
  switch (use) {
    case Use::Ca:
      addExtension(x, ctx, NID_basic_constraints, "critical,CA:TRUE");
      addExtension(x, ctx, NID_key_usage, "critical,keyCertSign,cRLSign");
      break;
    case Use::Server:
      addExtension(x, ctx, NID_basic_constraints, "critical,CA:FALSE");
      addExtension(x, ctx, NID_key_usage, "critical,digitalSignature");
      addExtension(x, ctx, NID_ext_key_usage, "serverAuth");
      addExtension(x, ctx, NID_subject_alt_name, "DNS:localhost,IP:127.0.0.1,IP:::1");
      break;
    case Use::Client:
      addExtension(x, ctx, NID_basic_constraints, "critical,CA:FALSE");
      addExtension(x, ctx, NID_key_usage, "critical,digitalSignature");
      addExtension(x, ctx, NID_ext_key_usage, "clientAuth");
      break;
  }
  if (X509_sign(x, issuerKey ? issuerKey : key, EVP_sha256()) == 0) failed("signing " + commonName);
  return cert;
}

std::unique_ptr<std::FILE, FileClose> create(const std::filesystem::path& file) {
  std::unique_ptr<std::FILE, FileClose> f(std::fopen(file.c_str(), "wb"));
  if (!f) throw std::runtime_error("test certificates: cannot write " + file.string());
  return f;
}

std::string writeCert(const std::filesystem::path& file, X509* cert) {
  const auto f = create(file);
  if (PEM_write_X509(f.get(), cert) != 1) failed("writing " + file.string());
  return file.string();
}

std::string writeKey(const std::filesystem::path& file, EVP_PKEY* key) {
  const auto f = create(file);
  if (PEM_write_PrivateKey(f.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1)
    failed("writing " + file.string());
  return file.string();
}

// A certificate and key from the CA, written as name.pem and name.key.
TestPki::Pair issue(const std::filesystem::path& dir, const std::string& name, X509* ca, EVP_PKEY* caKey, Use use,
                    long from = -kDay, long until = 365 * kDay) {
  const Key key = newKey();
  const Cert cert = makeCert(name, key.get(), ca, caKey, use, from, until);
  return {writeCert(dir / (name + ".pem"), cert.get()), writeKey(dir / (name + ".key"), key.get())};
}

}  // namespace

TestPki::TestPki(const std::filesystem::path& dir) {
  std::filesystem::create_directories(dir);
  const Key caKey = newKey();
  const Cert ca = makeCert("Test CA", caKey.get(), nullptr, nullptr, Use::Ca, -kDay, 365 * kDay);
  caFile = writeCert(dir / "ca.pem", ca.get());
  const Key otherKey = newKey();
  const Cert other = makeCert("Other CA", otherKey.get(), nullptr, nullptr, Use::Ca, -kDay, 365 * kDay);
  otherCaFile = writeCert(dir / "other-ca.pem", other.get());

  server = issue(dir, "server", ca.get(), caKey.get(), Use::Server);
  otherServer = issue(dir, "other-server", other.get(), otherKey.get(), Use::Server);
  client = issue(dir, "client", ca.get(), caKey.get(), Use::Client);
  otherClient = issue(dir, "other-client", other.get(), otherKey.get(), Use::Client);
  expiredClient = issue(dir, "expired-client", ca.get(), caKey.get(), Use::Client, -2 * kDay, -kDay);
}

}  // namespace testing_support
