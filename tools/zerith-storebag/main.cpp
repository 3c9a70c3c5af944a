// zerith-storebag: the operator's tool for signed storebag containers.
//
//   zerith-storebag keygen --private key.pem --public publicKey.der [--type rsa|ed25519]
//   zerith-storebag sign   --key key.pem [--ed25519-key ed.pem] --in bag.plist --out container.plist
//                          [--format binary|xml]
//   zerith-storebag verify --public publicKey.der [--ed25519-public publicKeyEd25519.der] --in container.plist
//   zerith-storebag show   --public publicKey.der [--ed25519-public publicKeyEd25519.der] --in container.plist
//   zerith-storebag lint   --in bag.plist
//   zerith-storebag [--root DIR] forget-issue-time --name dravon
//   zerith-storebag [--root DIR] cached [--folder DIR]
//
// `sign` stamps the bag with its issue time ("issue_time", now) before it
// signs it; `forget-issue-time` is the operator's way back past the daemon's
// anti-rollback check for one storebag name. `lint` says what the daemon
// would ignore in a bag or never enable (config/StorebagLint.h); `sign`
// prints the same findings on standard error and signs all the same.
// `cached` says what the daemon makes of each copy in its disk cache.
//
// Exit status 0 on success, 1 when an operation fails (unreadable input, a
// refused container, a bag with lint errors), CLI11's codes for usage errors.

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <optional>
#include <string>

#include <CLI/CLI.hpp>

#include "config/StorebagDiskCache.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagLint.h"
#include "config/StorebagSigner.h"
#include "config/StorebagVerify.h"
#include "platform/Crypto.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tools/zerith-storebag/StorebagCacheReport.h"

namespace {

using zerith::Data;
namespace fs = std::filesystem;

int failWith(const std::string& message) {
  std::cerr << "zerith-storebag: " << message << "\n";
  return 1;
}

std::optional<Data> readInput(const std::string& path, std::string& error) {
  std::error_code ec;
  if (!fs::exists(path, ec)) {
    error = "cannot read '" + path + "': no such file";
    return std::nullopt;
  }
  auto bytes = zerith::file::readAll(path, zerith::kMaxStorebagContainerBytes);
  if (!bytes) {
    error = "cannot read '" + path + "' (unreadable, not a regular file or larger than " +
            std::to_string(zerith::kMaxStorebagContainerBytes) + " bytes)";
  }
  return bytes;
}

bool writeOutput(const std::string& path, const Data& bytes, fs::perms perms, std::string& error) {
  const fs::path target = fs::absolute(path);
  if (!zerith::file::writeAtomically(target, bytes, perms)) {
    error = "cannot write '" + path + "'";
    return false;
  }
  return true;
}

int keygen(const std::string& privatePath, const std::string& publicPath, int bits, const std::string& type) {
  std::string error;
  const auto pair = type == "ed25519" ? zerith::generateStorebagEd25519KeyPair(&error)
                                      : zerith::generateStorebagKeyPair(bits, &error);
  if (!pair) {
    return failWith(error);
  }
  const Data pem(pair->privateKeyPEM.begin(), pair->privateKeyPEM.end());
  if (!writeOutput(privatePath, pem, fs::perms::owner_read | fs::perms::owner_write, error) ||
      !writeOutput(publicPath, pair->publicKeyDER, fs::perms(0644), error)) {
    return failWith(error);
  }
  std::cout << "wrote private key " << privatePath << " and public key " << publicPath << "\n";
  return 0;
}

int sign(const std::string& keyPath, const std::string& strongKeyPath, const std::string& inPath,
         const std::string& outPath, const std::string& format) {
  std::string error;
  const auto key = readInput(keyPath, error);
  if (!key) {
    return failWith(error);
  }
  std::optional<Data> strongKey;
  if (!strongKeyPath.empty() && !(strongKey = readInput(strongKeyPath, error))) {
    return failWith(error);
  }
  const auto input = readInput(inPath, error);
  if (!input) {
    return failWith(error);
  }
  if (const zerith::Value decoded = zerith::decodeStorebagBag(*input); !decoded.isNil()) {
    for (const auto& finding : zerith::lintStorebag(decoded)) {
      std::cerr << "zerith-storebag: " << inPath << ": " << finding.describe() << "\n";
    }
  }
  // Whole seconds: the XML form of a date keeps no fraction.
  const zerith::Date now{std::floor(zerith::Date::now().secondsSince1970)};
  const auto bag = zerith::stampStorebagIssueTime(*input, now, &error);
  if (!bag) {
    return failWith("'" + inPath + "' is " + error);
  }
  const auto signature = zerith::signStorebagBytes(std::string(key->begin(), key->end()), *bag, &error);
  if (!signature) {
    return failWith("cannot sign with '" + keyPath + "': " + error);
  }
  std::optional<Data> strongSignature;
  if (strongKey) {
    strongSignature =
        zerith::signStorebagBytes(std::string(strongKey->begin(), strongKey->end()), *bag, &error, /*ed25519=*/true);
    if (!strongSignature) {
      return failWith("cannot sign with '" + strongKeyPath + "': " + error);
    }
  }
  const auto container = zerith::makeStorebagContainer(*signature, *bag, strongSignature);
  Data out;
  if (format == "xml") {
    const std::string xml = zerith::plist::encodeXml(container);
    out.assign(xml.begin(), xml.end());
  } else {
    out = zerith::plist::encodeBinary(container);
  }
  if (!writeOutput(outPath, out, fs::perms(0644), error)) {
    return failWith(error);
  }
  std::cout << "signed " << bag->size() << " bag bytes" << (strongSignature ? " (RSA and Ed25519)" : "")
            << " issued " << zerith::describeIssueTime(now) << " into " << outPath << "\n";
  return 0;
}

// Verifies and, for `show`, prints the storebag as XML.
// With an Ed25519 key both signatures must verify, as in the daemon.
int check(const std::string& publicPath, const std::string& strongPublicPath, const std::string& inPath, bool show) {
  std::string error;
  const auto key = readInput(publicPath, error);
  if (!key) {
    return failWith(error);
  }
  std::optional<Data> strongKey;
  if (!strongPublicPath.empty() && !(strongKey = readInput(strongPublicPath, error))) {
    return failWith(error);
  }
  const auto container = readInput(inPath, error);
  if (!container) {
    return failWith(error);
  }
  const auto result = zerith::verifyStorebagContainer(zerith::plist::bytesOf(*container), key, strongKey);
  if (result.status != zerith::StorebagVerifyStatus::Verified) {
    return failWith("'" + inPath + "' refused: " + zerith::describeStorebagRefusal(result));
  }
  std::string why;
  const auto bag = zerith::decodeStorebagBag(result.bagBytes, &why);
  const auto issued = bag.isNil() ? std::nullopt : zerith::storebagIssueTime(bag, &why);
  if (!why.empty()) {
    return failWith("'" + inPath + "' is signed, but unusable: " + why);
  }
  if (show) {
    std::cout << zerith::plist::encodeXml(bag);
  } else {
    const zerith::Value versionValue = bag["version"];
    const auto* version = versionValue.string();
    std::cout << "verified" << (strongKey ? " (RSA and Ed25519)" : "") << ": " << result.bagBytes.size()
              << " bag bytes, version " << (version ? *version : "(none)") << ", issued "
              << (issued ? zerith::describeIssueTime(*issued) : std::string("(no issue time)")) << "\n";
  }
  return 0;
}

// The findings of a storebag, or of the bag inside a container (not
// verified: lint needs no key).
int lint(const std::string& inPath) {
  std::string error;
  const auto input = readInput(inPath, error);
  if (!input) {
    return failWith(error);
  }
  zerith::Value bag = zerith::decodeStorebagBag(*input, &error);
  const zerith::Value inside = bag["bag"];
  if (const std::string* text = inside.string(); text && bag["signature"].isString()) {
    std::cout << inPath << ": a signed container; its bag, not verified:\n";
    const auto inner = zerith::crypto::base64Decode(*text);
    error = "\"bag\" is not valid base64";
    bag = inner ? zerith::decodeStorebagBag(*inner, &error) : zerith::Value();
  }
  if (bag.isNil()) {
    return failWith("'" + inPath + "': " + error);
  }
  const auto findings = zerith::lintStorebag(bag);
  const auto errors = std::count_if(findings.begin(), findings.end(), [](const auto& f) { return f.error; });
  for (const auto& finding : findings) {
    std::cout << finding.describe() << "\n";
  }
  const auto counted = [](std::size_t n, const char* what) {
    return std::to_string(n) + " " + what + (n == 1 ? "" : "s");
  };
  std::cout << inPath << ": " << counted(static_cast<std::size_t>(errors), "error") << ", "
            << counted(findings.size() - static_cast<std::size_t>(errors), "warning") << "\n";
  return errors == 0 ? 0 : 1;
}

int forgetIssueTime(const std::string& root, const std::string& name) {
  zerith::paths::setRoot(root);
  std::optional<zerith::Date> forgotten;
  std::string error;
  if (!zerith::forgetStorebagIssueTime(name, forgotten, &error)) {
    return failWith(error);
  }
  if (forgotten) {
    std::cout << "forgot issue time " << zerith::describeIssueTime(*forgotten) << " of storebag " << name << " in "
              << zerith::storebagIssueTimesFile().string() << "\n";
  } else {
    std::cout << "no issue time remembered for storebag " << name << "\n";
  }
  return 0;
}

int cached(const std::string& root, const std::string& folderOption) {
  zerith::paths::setRoot(root);
  // Outside a relocated root the daemon's cache follows its service manager
  // (CacheDirectory=) or its user's home; an operator's shell has neither,
  // so the packaged service's folder is the one meant when it exists.
  fs::path folder = folderOption.empty() ? zerith::paths::storebagCacheDir() : fs::path(folderOption);
  const fs::path packaged = "/var/cache/zerithd/storebags";
  std::error_code ec;
  if (folderOption.empty() && !zerith::paths::relocated() && !std::getenv("CACHE_DIRECTORY") &&
      fs::is_directory(packaged, ec)) {
    folder = packaged;
  }
  std::string why;
  const auto report = zerith::reportStorebagCache(folder, &why);
  if (!report) {
    return failWith(why);
  }
  std::cout << zerith::describeStorebagCache(*report, zerith::Date::now());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Makes and checks signed zerithd storebag containers"};
  app.require_subcommand(1);

  std::string privatePath, publicPath, strongPublicPath, keyPath, strongKeyPath, inPath, outPath, name;
  std::string format = "binary", type = "rsa";
  std::string root = zerith::paths::defaultRoot().string();
  int bits = 2048;
  app.add_option("--root", root,
                 "Root folder of every zerithd path, for forget-issue-time and cached (environment ZERITHD_ROOT)");

  auto* keygenCmd = app.add_subcommand("keygen", "Create a key pair (PEM private key, DER public key)");
  keygenCmd->add_option("--private", privatePath, "Private key file to write (PEM)")->required();
  keygenCmd->add_option("--public", publicPath, "Public key file to write (DER)")->required();
  keygenCmd->add_option("--bits", bits, "RSA key size")->check(CLI::Range(2048, 8192));
  keygenCmd->add_option("--type", type, "rsa (publicKey.der) or ed25519 (publicKeyEd25519.der)")
      ->check(CLI::IsMember({"rsa", "ed25519"}));

  auto* signCmd = app.add_subcommand("sign", "Stamp a storebag (XML or binary property list) with its issue time and "
                                             "sign it into a container");
  signCmd->add_option("--key", keyPath, "RSA private key (PEM)")->required();
  signCmd->add_option("--ed25519-key", strongKeyPath, "Ed25519 private key (PEM): adds the second signature");
  signCmd->add_option("--in", inPath, "Storebag property list")->required();
  signCmd->add_option("--out", outPath, "Container to write")->required();
  signCmd->add_option("--format", format, "Container format")->check(CLI::IsMember({"binary", "xml"}));

  auto* verifyCmd = app.add_subcommand("verify", "Verify a container");
  auto* showCmd = app.add_subcommand("show", "Verify a container and print its storebag as XML");
  for (auto* cmd : {verifyCmd, showCmd}) {
    cmd->add_option("--public", publicPath, "RSA public key (DER)")->required();
    cmd->add_option("--ed25519-public", strongPublicPath, "Ed25519 public key (DER): its signature is required too");
    cmd->add_option("--in", inPath, "Container")->required();
  }

  auto* lintCmd = app.add_subcommand("lint", "Say what the daemon would ignore in a storebag or never enable (exit "
                                             "status 1 on errors)");
  lintCmd->add_option("--in", inPath, "Storebag property list, or a container (its bag is not verified)")
      ->required();

  auto* forgetCmd = app.add_subcommand("forget-issue-time", "Let the daemon accept an older storebag of this name "
                                                            "again (the operator's way back)");
  forgetCmd->add_option("--name", name, "Storebag name (dravon, ...)")->required();

  auto* cachedCmd = app.add_subcommand("cached", "Say what the daemon makes of each storebag in its disk cache: "
                                                 "age, signatures, issue time, used or refused");
  std::string cacheFolder;
  cachedCmd->add_option("--folder", cacheFolder,
                        "The cache folder (default: the root's, or /var/cache/zerithd/storebags of the packaged "
                        "service)");

  CLI11_PARSE(app, argc, argv);

  if (keygenCmd->parsed()) {
    return keygen(privatePath, publicPath, bits, type);
  }
  if (signCmd->parsed()) {
    return sign(keyPath, strongKeyPath, inPath, outPath, format);
  }
  if (lintCmd->parsed()) {
    return lint(inPath);
  }
  if (cachedCmd->parsed()) {
    return cached(root, cacheFolder);
  }
  if (forgetCmd->parsed()) {
    return forgetIssueTime(root, name);
  }
  return check(publicPath, strongPublicPath, inPath, showCmd->parsed());
}
