#pragma once

// The tests' local certificate authority, whose server certificates are for
// "localhost", 127.0.0.1 and ::1 unless told otherwise. Failures throw.
//
// `TestCA::shared()` is the one CA of a test process; its certificate and a
// server certificate and key are also written as PEM files into a folder of
// its own (removed at exit), for servers run as child processes and for the
// transport's extra-CA setting.

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "platform/LocalCertificateAuthority.h"

namespace zerith::test {

using zerith::IssuedCertificate;

class TestCA {
 public:
  explicit TestCA(const std::string& commonName = "zerith test CA");
  ~TestCA();
  TestCA(const TestCA&) = delete;
  TestCA& operator=(const TestCA&) = delete;

  // The process's shared CA (created on first use).
  static TestCA& shared();

  // A new leaf certificate for TLS servers, signed by this CA, valid from an
  // hour ago for 30 days.
  IssuedCertificate issueServerCertificate(const std::vector<std::string>& dnsNames = {"localhost"},
                                           const std::vector<std::string>& ipAddresses = {"127.0.0.1", "::1"}) const;

  // One server certificate for localhost/127.0.0.1/::1, issued on first use
  // and then reused.
  const IssuedCertificate& serverCertificate() const;

  // PEM files in the CA's own folder, written on first use.
  std::filesystem::path caFile() const;
  std::filesystem::path serverCertificateFile() const;
  std::filesystem::path serverKeyFile() const;

  struct Impl;

 private:
  std::unique_ptr<Impl> impl_;
};

}  // namespace zerith::test
