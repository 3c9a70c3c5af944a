#include "tests/support/TestCA.h"

#include <cstdlib>
#include <mutex>
#include <optional>
#include <stdexcept>

namespace zerith::test {

namespace {

constexpr std::chrono::seconds kLifetime = std::chrono::hours(24 * 30);

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error("TestCA: " + what); }

}  // namespace

struct TestCA::Impl {
  std::optional<LocalCertificateAuthority> ca;

  std::mutex mutex;
  std::optional<IssuedCertificate> server;
  std::filesystem::path folder;

  ~Impl() {
    if (!folder.empty()) {
      std::error_code ec;
      std::filesystem::remove_all(folder, ec);
    }
  }

  const IssuedCertificate& serverLocked(const TestCA& self) {
    if (!server) {
      server = self.issueServerCertificate();
    }
    return *server;
  }

  // `name` in the CA's folder, which is written on first use.
  std::filesystem::path file(const TestCA& self, const char* name) {
    std::lock_guard lock(mutex);
    if (folder.empty()) {
      std::string tmpl = (std::filesystem::temp_directory_path() / "zerith-ca-XXXXXX").string();
      if (!::mkdtemp(tmpl.data())) {
        fail("mkdtemp failed");
      }
      folder = tmpl;
      if (!ca->writeFiles(folder, serverLocked(self))) {
        fail("cannot write the PEM files into " + tmpl);
      }
    }
    return folder / name;
  }
};

TestCA::TestCA(const std::string& commonName) : impl_(std::make_unique<Impl>()) {
  std::string error;
  impl_->ca = LocalCertificateAuthority::create(commonName, kLifetime, &error);
  if (!impl_->ca) {
    fail(error);
  }
}

TestCA::~TestCA() = default;

TestCA& TestCA::shared() {
  static TestCA ca;
  return ca;
}

IssuedCertificate TestCA::issueServerCertificate(const std::vector<std::string>& dnsNames,
                                                 const std::vector<std::string>& ipAddresses) const {
  std::string error;
  auto issued = impl_->ca->issueServerCertificate(dnsNames, ipAddresses, kLifetime, &error);
  if (!issued) {
    fail(error);
  }
  return std::move(*issued);
}

const IssuedCertificate& TestCA::serverCertificate() const {
  std::lock_guard lock(impl_->mutex);
  return impl_->serverLocked(*this);
}

std::filesystem::path TestCA::caFile() const { return impl_->file(*this, "ca.pem"); }
std::filesystem::path TestCA::serverCertificateFile() const { return impl_->file(*this, "cert.pem"); }
std::filesystem::path TestCA::serverKeyFile() const { return impl_->file(*this, "key.pem"); }

}  // namespace zerith::test
