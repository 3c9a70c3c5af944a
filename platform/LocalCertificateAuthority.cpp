#include "platform/LocalCertificateAuthority.h"

#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <initializer_list>
#include <utility>

#include "platform/Crypto.h"
#include "platform/FileUtil.h"

namespace zerith {

namespace fs = std::filesystem;

namespace {

using GeneralNamesPtr = std::unique_ptr<GENERAL_NAMES, ossl::Deleter<GENERAL_NAMES_free>>;

constexpr long kClockSlackSeconds = 3600;

std::nullopt_t fail(std::string* error, std::string why) {
  ERR_clear_error();  // left behind, the entries would be read as the next TLS call's failure
  if (error) {
    *error = std::move(why);
  }
  return std::nullopt;
}

ossl::PkeyPtr newKey() { return ossl::PkeyPtr(EVP_EC_gen("P-256")); }

// A version 3 certificate for `key` named `commonName`, with a random serial
// number and its validity window; the issuer, extensions and signature are
// the caller's to add.
ossl::X509Ptr newCertificate(EVP_PKEY* key, const std::string& commonName, std::chrono::seconds lifetime) {
  ossl::X509Ptr cert(X509_new());
  ossl::BignumPtr serial(BN_new());
  if (!cert || !serial || X509_set_version(cert.get(), X509_VERSION_3) != 1 ||
      BN_rand(serial.get(), 63, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1 ||
      !BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(cert.get())) ||
      !X509_gmtime_adj(X509_getm_notBefore(cert.get()), -kClockSlackSeconds) ||
      !X509_gmtime_adj(X509_getm_notAfter(cert.get()), static_cast<long>(lifetime.count())) ||
      X509_set_pubkey(cert.get(), key) != 1 ||
      X509_NAME_add_entry_by_txt(X509_get_subject_name(cert.get()), "CN", MBSTRING_UTF8,
                                 reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1, 0) != 1) {
    return nullptr;
  }
  return cert;
}

bool addExtensions(X509* cert, X509* issuer, std::initializer_list<std::pair<int, const char*>> extensions) {
  X509V3_CTX ctx;
  X509V3_set_ctx_nodb(&ctx);
  X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
  for (const auto& [nid, value] : extensions) {
    ossl::X509ExtensionPtr ext(X509V3_EXT_conf_nid(nullptr, &ctx, nid, value));
    if (!ext || X509_add_ext(cert, ext.get(), -1) != 1) {
      return false;
    }
  }
  return true;
}

// Each name becomes one entry as it is; a comma in it cannot add others.
bool addSubjectAltNames(X509* cert, const std::vector<std::string>& dnsNames,
                        const std::vector<std::string>& ipAddresses) {
  GeneralNamesPtr names(sk_GENERAL_NAME_new_null());
  const auto add = [&](int type, const std::string& value) {
    GENERAL_NAME* name = a2i_GENERAL_NAME(nullptr, nullptr, nullptr, type, value.c_str(), 0);
    if (name && sk_GENERAL_NAME_push(names.get(), name) > 0) {
      return true;
    }
    GENERAL_NAME_free(name);
    return false;
  };
  if (!names) {
    return false;
  }
  for (const auto& dns : dnsNames) {
    if (!add(GEN_DNS, dns)) {
      return false;
    }
  }
  for (const auto& ip : ipAddresses) {
    if (!add(GEN_IPADD, ip)) {
      return false;
    }
  }
  return X509_add1_ext_i2d(cert, NID_subject_alt_name, names.get(), 0, X509V3_ADD_DEFAULT) == 1;
}

template <typename Write>
std::optional<std::string> pem(Write write) {
  ossl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || write(bio.get()) != 1) {
    return std::nullopt;
  }
  char* data = nullptr;
  const long size = BIO_get_mem_data(bio.get(), &data);
  return std::string(data, static_cast<std::size_t>(size));
}

std::optional<std::string> pemOf(X509* cert) {
  return pem([&](BIO* bio) { return PEM_write_bio_X509(bio, cert); });
}

std::optional<std::string> pemOf(EVP_PKEY* key) {
  return pem([&](BIO* bio) { return PEM_write_bio_PrivateKey(bio, key, nullptr, nullptr, 0, nullptr, nullptr); });
}

}  // namespace

std::optional<LocalCertificateAuthority> LocalCertificateAuthority::create(const std::string& commonName,
                                                                           std::chrono::seconds lifetime,
                                                                           std::string* error) {
  ossl::PkeyPtr key = newKey();
  if (!key) {
    return fail(error, "cannot make an EC key");
  }
  ossl::X509Ptr cert = newCertificate(key.get(), commonName, lifetime);
  X509* ca = cert.get();
  if (!ca || X509_set_issuer_name(ca, X509_get_subject_name(ca)) != 1 ||
      !addExtensions(ca, ca,
                     {{NID_basic_constraints, "critical,CA:TRUE"},
                      {NID_key_usage, "critical,keyCertSign,cRLSign"},
                      {NID_subject_key_identifier, "hash"}}) ||
      X509_sign(ca, key.get(), EVP_sha256()) == 0) {
    return fail(error, "cannot make the CA certificate " + commonName);
  }
  auto text = pemOf(ca);
  if (!text) {
    return fail(error, "cannot encode the CA certificate");
  }
  return LocalCertificateAuthority(std::move(key), std::move(cert), std::move(*text));
}

std::optional<IssuedCertificate> LocalCertificateAuthority::issueServerCertificate(
    const std::vector<std::string>& dnsNames, const std::vector<std::string>& ipAddresses,
    std::chrono::seconds lifetime, std::string* error) const {
  if (dnsNames.empty() && ipAddresses.empty()) {
    return fail(error, "a server certificate needs a DNS name or an IP address");
  }
  ossl::PkeyPtr key = newKey();
  if (!key) {
    return fail(error, "cannot make an EC key");
  }
  const std::string& name = dnsNames.empty() ? ipAddresses.front() : dnsNames.front();
  ossl::X509Ptr cert = newCertificate(key.get(), name, lifetime);
  X509* server = cert.get();
  // An EC key only signs the handshake: no key encipherment.
  if (!server || X509_set_issuer_name(server, X509_get_subject_name(certificate_.get())) != 1 ||
      !addExtensions(server, certificate_.get(),
                     {{NID_basic_constraints, "critical,CA:FALSE"},
                      {NID_key_usage, "critical,digitalSignature"},
                      {NID_ext_key_usage, "serverAuth"},
                      {NID_subject_key_identifier, "hash"},
                      {NID_authority_key_identifier, "keyid:always"}}) ||
      !addSubjectAltNames(server, dnsNames, ipAddresses) || X509_sign(server, key_.get(), EVP_sha256()) == 0) {
    return fail(error, "cannot make a server certificate for " + name);
  }
  auto certificateText = pemOf(server);
  auto keyText = pemOf(key.get());
  if (!certificateText || !keyText) {
    return fail(error, "cannot encode the server certificate");
  }
  return IssuedCertificate{std::move(*certificateText), std::move(*keyText)};
}

bool LocalCertificateAuthority::writeFiles(const fs::path& folder, const IssuedCertificate& server) const {
  const auto write = [&](const char* name, const std::string& text, fs::perms perms) {
    return file::writeAtomically(folder / name, crypto::bytesOf(text), perms);
  };
  // ca.pem last: when it is there, the others are too.
  return write("key.pem", server.privateKeyPem, fs::perms(0600)) &&
         write("cert.pem", server.certificatePem, fs::perms(0644)) && write("ca.pem", pem_, fs::perms(0644));
}

}  // namespace zerith
