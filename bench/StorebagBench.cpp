// Storebag benchmarks:
// - verification of a signed container of about 100 KB, as the fetch does
//   it (public key read from disk, structural check, parse, base64, RSA
//   SHA-1 verification, bag decode), and the bare signature check, alone
//   and with the second (Ed25519) signature;
// - a lookup in the agent's storebag cache that the entry answers (the disk
//   cache date is still asked for at every lookup).

#include <benchmark/benchmark.h>

#include <cstdlib>
#include <filesystem>
#include <cstring>
#include <string>

#include <openssl/evp.h>
#include <openssl/x509.h>
#include <plist/plist.h>

#include "config/StorebagDiskCache.h"
#include "config/StorebagSigner.h"
#include "config/StorebagVerify.h"
#include "daemon/StorebagCache.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "zerith/ZerithBundle.h"

namespace {

using namespace zerith;

// A private root for the benchmark's files, removed at exit.
struct BenchRoot {
  std::filesystem::path path;
  BenchRoot() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "zerith-bench-XXXXXX").string();
    path = ::mkdtemp(tmpl.data());
    paths::setRoot(path);
  }
  ~BenchRoot() {
    std::error_code ec;
    std::filesystem::remove_all(path, ec);
  }
};

BenchRoot& root() {
  static BenchRoot r;
  return r;
}

const StorebagKeyPair& keys() {
  static const StorebagKeyPair k = *generateStorebagKeyPair(2048);
  return k;
}

// A storebag of about `bytes` bytes in binary form: four environment
// sections of backend profiles with URLs, filters and sampling settings.
Value largeStorebag(std::size_t bytes) {
  Dictionary bag;
  for (const char* environment : {"development", "velmar_internal", "seed", "release"}) {
    Dictionary section;
    for (int backend = 0; backend < 40; ++backend) {
      Array whitelist;
      for (int e = 0; e < 20; ++e) {
        whitelist.push_back(Value(Dictionary{{"category", e}, {"type", e * 7 + backend}}));
      }
      section.set("backend" + std::to_string(backend),
                  Value(Dictionary{{"active", true},
                                   {"url", "https://collector.example.invalid/post/" + std::to_string(backend)},
                                   {"samplingRate", 0.25},
                                   {"batchSize", 50},
                                   {"whitelist", Value(std::move(whitelist))}}));
    }
    bag.set(environment, Value(std::move(section)));
  }
  bag.set("version", "9.9.9");
  Value value(bag);
  // Pad to the requested size with an opaque entry.
  const std::size_t encoded = plist::encodeBinary(value).size();
  if (encoded < bytes) {
    bag.set("padding", std::string(bytes - encoded, 'p'));
  }
  return Value(std::move(bag));
}

const Data& container100KB() {
  static const Data c = *signStorebagContainer(keys().privateKeyPEM, plist::encodeBinary(largeStorebag(100 * 1024)));
  return c;
}

void BM_ParseAndVerifyStorebag100KB(benchmark::State& state) {
  root();
  std::filesystem::create_directories(frameworkPublicKeyPath().parent_path());
  file::writeAtomically(frameworkPublicKeyPath(), keys().publicKeyDER);
  const Data& container = container100KB();
  for (auto _ : state) {
    Value bag = parseAndVerifyStorebag("ambrel", container, false);
    if (bag.isNil()) {
      state.SkipWithError("verification failed");
      break;
    }
    benchmark::DoNotOptimize(bag);
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * container.size()));
  state.counters["verifications/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
  state.counters["container_bytes"] = static_cast<double>(container.size());
}
BENCHMARK(BM_ParseAndVerifyStorebag100KB)->Unit(benchmark::kMicrosecond);

void BM_VerifyStorebagContainer100KB(benchmark::State& state) {
  const Data& container = container100KB();
  const std::optional<Data> key = keys().publicKeyDER;
  for (auto _ : state) {
    auto result = verifyStorebagContainer(container, key);
    benchmark::DoNotOptimize(result);
  }
  state.counters["verifications/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_VerifyStorebagContainer100KB)->Unit(benchmark::kMicrosecond);

// The same with the Ed25519 key installed: both signatures are checked, so
// the difference to the one above is the second signature's cost.
void BM_VerifyStorebagContainerBothSignatures100KB(benchmark::State& state) {
  static const StorebagKeyPair strong = *generateStorebagEd25519KeyPair();
  static const Data container = *signStorebagContainer(
      keys().privateKeyPEM, plist::encodeBinary(largeStorebag(100 * 1024)), nullptr, strong.privateKeyPEM);
  const std::optional<Data> key = keys().publicKeyDER;
  const std::optional<Data> strongKey = strong.publicKeyDER;
  for (auto _ : state) {
    auto result = verifyStorebagContainer(container, key, strongKey);
    if (result.status != StorebagVerifyStatus::Verified) {
      state.SkipWithError("verification failed");
      break;
    }
    benchmark::DoNotOptimize(result);
  }
  state.counters["verifications/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_VerifyStorebagContainerBothSignatures100KB)->Unit(benchmark::kMicrosecond);

// The reference in the same run: the libraries' own work on the same bytes,
// with no checks of ours: libplist parses the container, OpenSSL decodes the
// two base64 texts, builds the key from DER and verifies SHA-1/PKCS#1 v1.5,
// libplist parses the bag. parseAndVerifyStorebag divided by this is the
// cost of our structural checks, value tree and key file read.
void BM_ReferenceLibrariesOnly100KB(benchmark::State& state) {
  const Data& container = container100KB();
  const Data& der = keys().publicKeyDER;
  auto decode = [](const char* text) {
    const std::size_t n = std::strlen(text);
    Data out(3 * (n / 4) + 3);
    const int len = EVP_DecodeBlock(out.data(), reinterpret_cast<const unsigned char*>(text), static_cast<int>(n));
    std::size_t size = len < 0 ? 0 : static_cast<std::size_t>(len);
    for (std::size_t i = n; i > 0 && text[i - 1] == '='; --i) --size;  // EVP_DecodeBlock keeps padding bytes
    out.resize(size);
    return out;
  };
  for (auto _ : state) {
    plist_t root = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(container.data()), static_cast<std::uint32_t>(container.size()), &root);
    char* sigText = nullptr;
    char* bagText = nullptr;
    plist_get_string_val(plist_dict_get_item(root, "signature"), &sigText);
    plist_get_string_val(plist_dict_get_item(root, "bag"), &bagText);
    const Data signature = decode(sigText);
    const Data bag = decode(bagText);
    const unsigned char* p = der.data();
    EVP_PKEY* key = d2i_PUBKEY(nullptr, &p, static_cast<long>(der.size()));
    EVP_MD_CTX* ctx = EVP_MD_CTX_new();
    EVP_DigestVerifyInit(ctx, nullptr, EVP_sha1(), nullptr, key);
    const int ok = EVP_DigestVerify(ctx, signature.data(), signature.size(), bag.data(), bag.size());
    EVP_MD_CTX_free(ctx);
    EVP_PKEY_free(key);
    plist_t bagRoot = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(bag.data()), static_cast<std::uint32_t>(bag.size()), &bagRoot);
    if (ok != 1 || !bagRoot) {
      state.SkipWithError("reference verification failed");
    }
    plist_free(bagRoot);
    std::free(sigText);
    std::free(bagText);
    plist_free(root);
  }
  state.counters["verifications/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_ReferenceLibrariesOnly100KB)->Unit(benchmark::kMicrosecond);

void BM_CachedStorebagLookup(benchmark::State& state) {
  root();
  // A cache file exists, older than the entry, as after a normal fetch.
  saveStorebagToDisk("ambrel", container100KB());
  const Value section = largeStorebag(100 * 1024)["release"];
  StorebagCache cache([] { return Date::now(); },
                      [&section](std::int32_t, std::int32_t& maxAge, Value& version, bool&) {
                        maxAge = 86400;
                        version = Value("9.9.9");
                        return section;
                      },
                      [](const std::string& name) { return storebagCacheModificationDate(name); });
  cache.storebagForClientType(5, 1);  // fills the entry
  for (auto _ : state) {
    Value bag = cache.storebagForClientType(5, 1);
    benchmark::DoNotOptimize(bag);
  }
  state.counters["lookups/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_CachedStorebagLookup);

}  // namespace

BENCHMARK_MAIN();
