#include "platform/OpenSSLHandles.h"
#include "tests/support/TestCA.h"

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/ec.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <cstdlib>
#include <fstream>
#include <mutex>
#include <optional>
#include <stdexcept>

namespace zerith::test {

namespace {

[[noreturn]] void fail(const char* what) { throw std::runtime_error(std::string("TestCA: ") + what); }

ossl::PkeyPtr newKey() {
  ossl::PkeyPtr key(EVP_EC_gen("P-256"));
  if (!key) {
    fail("key generation failed");
  }
  return key;
}

void addExtension(X509* cert, X509* issuer, int nid, const std::string& value) {
  X509V3_CTX ctx;
  X509V3_set_ctx_nodb(&ctx);
  X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
  ossl::X509ExtensionPtr ext(X509V3_EXT_conf_nid(nullptr, &ctx, nid, value.c_str()));
  if (!ext || X509_add_ext(cert, ext.get(), -1) != 1) {
    fail("extension rejected");
  }
}

ossl::X509Ptr newCertificate(EVP_PKEY* subjectKey, const std::string& commonName) {
  ossl::X509Ptr cert(X509_new());
  if (!cert || X509_set_version(cert.get(), X509_VERSION_3) != 1) {
    fail("certificate allocation failed");
  }
  ossl::BignumPtr serial(BN_new());
  if (!serial || BN_rand(serial.get(), 63, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1 ||
      !BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(cert.get()))) {
    fail("serial number failed");
  }
  // An hour of slack before now tolerates clocks that disagree a little.
  X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600);
  X509_gmtime_adj(X509_getm_notAfter(cert.get()), 30L * 24 * 3600);
  X509_set_pubkey(cert.get(), subjectKey);
  X509_NAME* name = X509_get_subject_name(cert.get());
  X509_NAME_add_entry_by_txt(name, "O", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>("zerith tests"), -1, -1, 0);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1,
                             0);
  return cert;
}

// The PEM text that `write` puts into a memory BIO.
template <typename Write>
std::string pem(Write write) {
  ossl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || write(bio.get()) != 1) {
    fail("PEM encoding failed");
  }
  char* data = nullptr;
  const long n = BIO_get_mem_data(bio.get(), &data);
  return std::string(data, static_cast<std::size_t>(n));
}

std::string pemOf(X509* cert) {
  return pem([&](BIO* bio) { return PEM_write_bio_X509(bio, cert); });
}

std::string pemOf(EVP_PKEY* key) {
  return pem([&](BIO* bio) { return PEM_write_bio_PrivateKey(bio, key, nullptr, nullptr, 0, nullptr, nullptr); });
}

void writeFile(const std::filesystem::path& path, const std::string& contents) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << contents;
  if (!out.flush()) {
    fail("cannot write PEM file");
  }
}

}  // namespace

struct TestCA::Impl {
  ossl::PkeyPtr key;
  ossl::X509Ptr certificate;
  std::string pem;

  std::mutex mutex;
  std::optional<IssuedCertificate> server;
  std::filesystem::path folder;

  ~Impl() {
    if (!folder.empty()) {
      std::error_code ec;
      std::filesystem::remove_all(folder, ec);
    }
  }

  const IssuedCertificate& serverLocked(const TestCA& ca) {
    if (!server) {
      server = ca.issueServerCertificate();
    }
    return *server;
  }

  // `name` in the CA's folder, which is written on first use.
  std::filesystem::path file(const TestCA& ca, const char* name) {
    std::lock_guard lock(mutex);
    if (folder.empty()) {
      std::string tmpl = (std::filesystem::temp_directory_path() / "zerith-ca-XXXXXX").string();
      if (!::mkdtemp(tmpl.data())) {
        fail("mkdtemp failed");
      }
      const auto& issued = serverLocked(ca);
      writeFile(std::filesystem::path(tmpl) / "ca.pem", pem);
      writeFile(std::filesystem::path(tmpl) / "server.pem", issued.certificatePem);
      writeFile(std::filesystem::path(tmpl) / "server-key.pem", issued.privateKeyPem);
      folder = tmpl;
    }
    return folder / name;
  }
};

TestCA::TestCA(const std::string& commonName) : impl_(std::make_unique<Impl>()) {
  impl_->key = newKey();
  impl_->certificate = newCertificate(impl_->key.get(), commonName);
  X509* cert = impl_->certificate.get();
  X509_set_issuer_name(cert, X509_get_subject_name(cert));
  addExtension(cert, cert, NID_basic_constraints, "critical,CA:TRUE");
  addExtension(cert, cert, NID_key_usage, "critical,keyCertSign,cRLSign");
  addExtension(cert, cert, NID_subject_key_identifier, "hash");
  if (X509_sign(cert, impl_->key.get(), EVP_sha256()) == 0) {
    fail("signing the CA certificate failed");
  }
  impl_->pem = pemOf(cert);
}

TestCA::~TestCA() = default;

TestCA& TestCA::shared() {
  static TestCA ca;
  return ca;
}

const std::string& TestCA::certificatePem() const { return impl_->pem; }

IssuedCertificate TestCA::issueServerCertificate(const std::vector<std::string>& dnsNames,
                                                 const std::vector<std::string>& ipAddresses) const {
  ossl::PkeyPtr key = newKey();
  const std::string cn = dnsNames.empty() ? (ipAddresses.empty() ? "server" : ipAddresses.front()) : dnsNames.front();
  ossl::X509Ptr cert = newCertificate(key.get(), cn);
  X509_set_issuer_name(cert.get(), X509_get_subject_name(impl_->certificate.get()));
  std::string san;
  for (const auto& d : dnsNames) {
    san += (san.empty() ? "" : ",") + std::string("DNS:") + d;
  }
  for (const auto& ip : ipAddresses) {
    san += (san.empty() ? "" : ",") + std::string("IP:") + ip;
  }
  X509* issuer = impl_->certificate.get();
  addExtension(cert.get(), issuer, NID_basic_constraints, "critical,CA:FALSE");
  addExtension(cert.get(), issuer, NID_key_usage, "critical,digitalSignature,keyEncipherment");
  addExtension(cert.get(), issuer, NID_ext_key_usage, "serverAuth");
  addExtension(cert.get(), issuer, NID_subject_key_identifier, "hash");
  addExtension(cert.get(), issuer, NID_authority_key_identifier, "keyid:always");
  if (!san.empty()) {
    addExtension(cert.get(), issuer, NID_subject_alt_name, san);
  }
  if (X509_sign(cert.get(), impl_->key.get(), EVP_sha256()) == 0) {
    fail("signing the server certificate failed");
  }
  return IssuedCertificate{pemOf(cert.get()), pemOf(key.get())};
}

const IssuedCertificate& TestCA::serverCertificate() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->serverLocked(*this);
}

std::filesystem::path TestCA::caFile() const { return impl_->file(*this, "ca.pem"); }
std::filesystem::path TestCA::serverCertificateFile() const { return impl_->file(*this, "server.pem"); }
std::filesystem::path TestCA::serverKeyFile() const { return impl_->file(*this, "server-key.pem"); }

}  // namespace zerith::test
