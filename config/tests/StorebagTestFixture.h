#pragma once

// Scenario helpers shared by the storebag tests: a temporary root with the
// framework's public key installed, signing keys made once per process,
// signed containers, the defaults that steer a fetch and the cache state.

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "config/StorebagDiskCache.h"
#include "config/StorebagSigner.h"
#include "platform/FileUtil.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithBundle.h"

namespace zerith::test {

// Two key pairs for the whole test process (RSA key generation is slow).
inline const StorebagKeyPair& storebagKeys() {
  static const StorebagKeyPair keys = *generateStorebagKeyPair(2048);
  return keys;
}
inline const StorebagKeyPair& otherStorebagKeys() {
  static const StorebagKeyPair keys = *generateStorebagKeyPair(2048);
  return keys;
}

// A storebag proper with every environment section.
inline Value sampleStorebag(const std::string& version = "2.4.0") {
  auto section = [](const char* environment) {
    return Value(Dictionary{{"kovu", Value(Dictionary{{"active", true}, {"environment", environment}})}});
  };
  return Value(Dictionary{{"development", section("development")},
                          {"velmar_internal", section("velmar_internal")},
                          {"seed", section("seed")},
                          {"release", section("release")},
                          {"version", version}});
}

inline Value withoutKey(const Value& dict, const char* key) {
  Dictionary copy = dict.dictCopy();
  copy.erase(key);
  return Value(std::move(copy));
}

inline Value withEntry(const Value& dict, const char* key, Value value) {
  Dictionary copy = dict.dictCopy();
  copy.set(key, std::move(value));
  return Value(std::move(copy));
}

// A container of `bag` (encoded as a binary list) signed with `keys`.
inline Data signedContainer(const Value& bag, const StorebagKeyPair& keys = storebagKeys()) {
  return *signStorebagContainer(keys.privateKeyPEM, plist::encodeBinary(bag));
}

inline std::string text(const Data& d) { return std::string(d.begin(), d.end()); }
inline Data bytes(const std::string& s) { return Data(s.begin(), s.end()); }

class StorebagTest : public ::testing::Test {
 protected:
  StorebagTest() { installPublicKey(storebagKeys().publicKeyDER); }

  void installPublicKey(const Data& der) {
    std::filesystem::create_directories(frameworkPublicKeyPath().parent_path());
    ASSERT_TRUE(file::writeAtomically(frameworkPublicKeyPath(), der));
  }
  void setFrameworkVersion(const std::string& version) {
    root_.write("/usr/share/zerith/Info.plist",
                plist::encodeXml(Value(Dictionary{{"BundleVersion", version}})));
  }
  void setEnvironment(int type) { setDefaultsObjectForKey("environmentType", type); }
  void setServer(const std::string& url) { setDefaultsObjectForKey("zerith_storebag_url", url); }

  // Puts a container into the disk cache with the given metrics.
  void cache(const std::string& name, const Data& container, std::optional<int> maxAge,
             std::optional<std::string> lastModified = std::nullopt) {
    std::filesystem::create_directories(paths::storebagCacheDir());
    ASSERT_TRUE(file::writeAtomically(paths::storebagCacheDir() / name, container));
    setDefaultsObjectForKey(storebagMetricsKey(name, "max-age"), maxAge ? Value(*maxAge) : Value());
    setDefaultsObjectForKey(storebagMetricsKey(name, "Last-Modified"), lastModified ? Value(*lastModified) : Value());
  }
  std::optional<Data> cached(const std::string& name) const {
    return file::readAll(paths::storebagCacheDir() / name, 64u << 20);
  }
  Value metric(const std::string& name, const char* field) const {
    return defaultsObjectForKey(storebagMetricsKey(name, field));
  }

  TempRoot root_;
  log::LogCapture logs_;
};

}  // namespace zerith::test
