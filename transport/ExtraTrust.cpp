#include "platform/OpenSSLHandles.h"
#include "transport/ExtraTrust.h"

#include <curl/curl.h>
#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "platform/Log.h"

namespace zerith {

namespace {

const log::Logger& logger() {
  static const auto* l = new log::Logger("transport");  // used until the process ends
  return *l;
}


bool writeAll(int fd, const std::string& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      return false;
    }
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

ExtraTrust& ExtraTrust::instance() {
  static auto* trust = new ExtraTrust();  // read by the transport thread until the process ends
  return *trust;
}

ExtraTrust::ExtraTrust() {
  const curl_version_info_data* info = curl_version_info(CURLVERSION_NOW);
  systemBundle_ = info->cainfo ? info->cainfo : X509_get_default_cert_file();
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
    extraPem_.clear();
    bundle_.clear();
    return true;
  }
  ossl::BioPtr in(BIO_new_file(path.c_str(), "r"));
  if (!in) {
    ERR_clear_error();
    logger().error("URLSession: cannot read the extra CA file {}", path);
    return false;
  }
  ossl::BioPtr out(BIO_new(BIO_s_mem()));
  std::size_t count = 0;
  while (ossl::X509Ptr cert{PEM_read_bio_X509(in.get(), nullptr, nullptr, nullptr)}) {
    PEM_write_bio_X509(out.get(), cert.get());
    ++count;
  }
  ERR_clear_error();  // the end of the file reads as an error
  if (count == 0) {
    logger().error("URLSession: the extra CA file {} holds no certificate", path);
    return false;
  }
  char* pem = nullptr;
  const long size = BIO_get_mem_data(out.get(), &pem);
  path_ = path;
  extraPem_.assign(pem, static_cast<std::size_t>(size));
  bundle_.clear();
  logger().info("URLSession: trusting {} extra certificate authorities from {}", count, path_);
  return true;
}

std::string ExtraTrust::file() const {
  std::lock_guard lock(mutex_);
  return path_;
}

std::string ExtraTrust::bundlePath(bool& failed) {
  failed = false;
  std::lock_guard lock(mutex_);
  if (extraPem_.empty()) {
    return {};
  }
  struct stat st {};
  const bool haveSystem = ::stat(systemBundle_.c_str(), &st) == 0;
  const bool systemChanged = haveSystem && (st.st_size != systemSize_ || st.st_mtim.tv_sec != systemModified_.tv_sec ||
                                            st.st_mtim.tv_nsec != systemModified_.tv_nsec);
  if (!bundle_.empty() && !systemChanged) {
    return bundle_;
  }
  std::string contents;
  if (haveSystem) {
    if (const auto system = file::readAll(systemBundle_, 64 << 20)) {
      contents.assign(system->begin(), system->end());
      contents += '\n';
    }
  }
  contents += extraPem_;
  file::UniqueFd fd(::memfd_create("zerithd-ca-bundle", MFD_CLOEXEC));
  if (!fd || !writeAll(fd.get(), contents)) {
    logger().error("URLSession: cannot make the CA bundle with the extra authorities ({})", std::strerror(errno));
    failed = true;
    return {};
  }
  bundle_ = "/proc/self/fd/" + std::to_string(fd.get());
  bundles_.push_back(std::move(fd));
  systemSize_ = haveSystem ? st.st_size : -1;
  systemModified_ = haveSystem ? st.st_mtim : timespec{};
  return bundle_;
}

}  // namespace zerith
