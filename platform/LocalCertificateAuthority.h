#pragma once

// A certificate authority made on the spot for TLS on the loopback: an EC
// P-256 key with a self-signed CA certificate, and the server certificates
// it issues. Nothing is read from or written to the system's trust store;
// whoever talks to the servers is handed the CA certificate to trust.

#include <chrono>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/OpenSSLHandles.h"

namespace zerith {

struct IssuedCertificate {
  std::string certificatePem;
  std::string privateKeyPem;  // unencrypted
};

class LocalCertificateAuthority {
 public:
  // A new CA named `commonName`. Its certificates (this one and those it
  // issues) are valid from an hour ago, which tolerates clocks that disagree
  // a little, until `lifetime` from now. nullopt with the reason in `*error`.
  static std::optional<LocalCertificateAuthority> create(const std::string& commonName, std::chrono::seconds lifetime,
                                                         std::string* error);

  const std::string& certificatePem() const { return pem_; }

  // A new key and a certificate for TLS servers answering to these DNS names
  // and IP addresses (at least one name), named after the first of them.
  std::optional<IssuedCertificate> issueServerCertificate(const std::vector<std::string>& dnsNames,
                                                          const std::vector<std::string>& ipAddresses,
                                                          std::chrono::seconds lifetime, std::string* error) const;

  // ca.pem, cert.pem and key.pem (the key 0600, the others 0644), each written
  // atomically into `folder`, which must exist.
  bool writeFiles(const std::filesystem::path& folder, const IssuedCertificate& server) const;

 private:
  LocalCertificateAuthority(ossl::PkeyPtr key, ossl::X509Ptr certificate, std::string pem)
      : key_(std::move(key)), certificate_(std::move(certificate)), pem_(std::move(pem)) {}

  ossl::PkeyPtr key_;
  ossl::X509Ptr certificate_;
  std::string pem_;
};

}  // namespace zerith
