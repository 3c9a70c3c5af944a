#pragma once

// The certificate authorities trusted beside the system store, for every
// TLS connection of the process (URLSession::setExtraCAFile). Process-wide by
// design: the daemon sets it once from its command line.

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <openssl/x509.h>

namespace zerith {

class ExtraTrust {
 public:
  static ExtraTrust& instance();

  // Loads every certificate of a PEM file; "" removes them. False (and the
  // previous set kept) when the file cannot be read or holds none.
  bool setFile(const std::string& path);
  std::string file() const;
  bool empty() const;
  // Adds the certificates to a connection's verification store.
  void addTo(X509_STORE* store) const;

  struct X509Free {
    void operator()(X509* x) const { X509_free(x); }
  };

 private:
  ExtraTrust();
  bool setFileLocked(const std::string& path);

  mutable std::mutex mutex_;
  std::string path_;
  std::vector<std::unique_ptr<X509, X509Free>> certificates_;
};

}  // namespace zerith
