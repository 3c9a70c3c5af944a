#include "transport/ExtraTrust.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include <cstdlib>

#include "platform/Log.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  static const auto* l = new log::Logger("transport");  // used until the process ends
  return *l;
}

struct BioFree {
  void operator()(BIO* b) const { BIO_free(b); }
};

}  // namespace

ExtraTrust& ExtraTrust::instance() {
  static auto* trust = new ExtraTrust();  // read by the transport thread until the process ends
  return *trust;
}

ExtraTrust::ExtraTrust() {
  if (const char* env = std::getenv("ZERITHD_CA_FILE"); env && *env) {
    std::lock_guard lock(mutex_);
    setFileLocked(env);
  }
}

bool ExtraTrust::setFile(const std::string& path) {
  std::lock_guard lock(mutex_);
  return setFileLocked(path);
}

bool ExtraTrust::setFileLocked(const std::string& path) {
  if (path.empty()) {
    path_.clear();
    certificates_.clear();
    return true;
  }
  std::unique_ptr<BIO, BioFree> bio(BIO_new_file(path.c_str(), "r"));
  if (!bio) {
    ERR_clear_error();
    logger().error("URLSession: cannot read the extra CA file {}", path);
    return false;
  }
  std::vector<std::unique_ptr<X509, X509Free>> loaded;
  while (X509* cert = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)) {
    loaded.emplace_back(cert);
  }
  ERR_clear_error();  // the end of the file reads as an error
  if (loaded.empty()) {
    logger().error("URLSession: the extra CA file {} holds no certificate", path);
    return false;
  }
  path_ = path;
  certificates_ = std::move(loaded);
  logger().info("URLSession: trusting {} extra certificate authorities from {}", certificates_.size(), path_);
  return true;
}

std::string ExtraTrust::file() const {
  std::lock_guard lock(mutex_);
  return path_;
}

bool ExtraTrust::empty() const {
  std::lock_guard lock(mutex_);
  return certificates_.empty();
}

void ExtraTrust::addTo(X509_STORE* store) const {
  std::lock_guard lock(mutex_);
  for (const auto& cert : certificates_) {
    X509_STORE_add_cert(store, cert.get());  // a duplicate is harmless
  }
  ERR_clear_error();
}

}  // namespace zerith
