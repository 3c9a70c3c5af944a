// zerith-storebag: the operator's tool for signed storebag containers.
//
//   zerith-storebag keygen --private key.pem --public publicKey.der
//   zerith-storebag sign   --key key.pem --in bag.plist --out container.plist [--format binary|xml]
//   zerith-storebag verify --public publicKey.der --in container.plist
//   zerith-storebag show   --public publicKey.der --in container.plist
//
// Exit status 0 on success, 1 when an operation fails (unreadable input, a
// refused container), CLI11's codes for usage errors.

#include <cstdio>
#include <filesystem>
#include <iostream>
#include <optional>
#include <string>

#include <CLI/CLI.hpp>

#include "config/StorebagDiskCache.h"
#include "config/StorebagSigner.h"
#include "config/StorebagVerify.h"
#include "platform/FileUtil.h"
#include "platform/PropertyList.h"

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

std::string describe(zerith::StorebagVerifyStatus status, const std::string& parseError,
                     const std::string& verifyError) {
  using S = zerith::StorebagVerifyStatus;
  switch (status) {
    case S::Verified: return "verified";
    case S::NotAPropertyList: return "the container is not a property list: " + parseError;
    case S::SignatureMissing: return "the container has no \"signature\" string";
    case S::BadPublicKey: return "the public key is not an RSA public key in DER form";
    case S::BadSignatureText: return "\"signature\" is not valid base64";
    case S::BadBagText: return "\"bag\" is missing or not valid base64";
    case S::SignatureMismatch: return "the signature does not match the bag under this public key (" + verifyError + ")";
  }
  return "unknown failure";
}

int keygen(const std::string& privatePath, const std::string& publicPath, int bits) {
  std::string error;
  const auto pair = zerith::generateStorebagKeyPair(bits, &error);
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

int sign(const std::string& keyPath, const std::string& inPath, const std::string& outPath, const std::string& format) {
  std::string error;
  const auto key = readInput(keyPath, error);
  if (!key) {
    return failWith(error);
  }
  const auto bag = readInput(inPath, error);
  if (!bag) {
    return failWith(error);
  }
  std::string why;
  const auto parsed = zerith::plist::decode(zerith::plist::bytesOf(*bag), zerith::storebagBagLimits(), &why);
  if (!parsed) {
    return failWith("'" + inPath + "' is not a property list: " + why);
  }
  if (!parsed->isDict()) {
    return failWith("'" + inPath + "' is not a property list dictionary");
  }
  const auto signature = zerith::signStorebagBytes(std::string(key->begin(), key->end()), *bag, &error);
  if (!signature) {
    return failWith("cannot sign with '" + keyPath + "': " + error);
  }
  const auto container = zerith::makeStorebagContainer(*signature, *bag);
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
  std::cout << "signed " << bag->size() << " bag bytes into " << outPath << "\n";
  return 0;
}

// Verifies and, for `show`, prints the storebag as XML.
int check(const std::string& publicPath, const std::string& inPath, bool show) {
  std::string error;
  const auto key = readInput(publicPath, error);
  if (!key) {
    return failWith(error);
  }
  const auto container = readInput(inPath, error);
  if (!container) {
    return failWith(error);
  }
  const auto result = zerith::verifyStorebagContainer(zerith::plist::bytesOf(*container), key);
  if (result.status != zerith::StorebagVerifyStatus::Verified) {
    return failWith("'" + inPath + "' refused: " + describe(result.status, result.parseError, result.verifyError));
  }
  const auto bag = zerith::decodeStorebagBag(result.bagBytes);
  if (bag.isNil()) {
    return failWith("'" + inPath + "' is signed, but its bag is not a property list dictionary");
  }
  if (show) {
    std::cout << zerith::plist::encodeXml(bag);
  } else {
    const zerith::Value versionValue = bag["version"];
    const auto* version = versionValue.string();
    std::cout << "verified: " << result.bagBytes.size() << " bag bytes, version " << (version ? *version : "(none)")
              << "\n";
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Makes and checks signed zerithd storebag containers"};
  app.require_subcommand(1);

  std::string privatePath, publicPath, keyPath, inPath, outPath, format = "binary";
  int bits = 2048;

  auto* keygenCmd = app.add_subcommand("keygen", "Create an RSA key pair (PEM private key, DER public key)");
  keygenCmd->add_option("--private", privatePath, "Private key file to write (PEM)")->required();
  keygenCmd->add_option("--public", publicPath, "Public key file to write (DER)")->required();
  keygenCmd->add_option("--bits", bits, "Key size")->check(CLI::Range(2048, 8192));

  auto* signCmd = app.add_subcommand("sign", "Sign a storebag (XML or binary property list) into a container");
  signCmd->add_option("--key", keyPath, "Private key (PEM)")->required();
  signCmd->add_option("--in", inPath, "Storebag property list")->required();
  signCmd->add_option("--out", outPath, "Container to write")->required();
  signCmd->add_option("--format", format, "Container format")->check(CLI::IsMember({"binary", "xml"}));

  auto* verifyCmd = app.add_subcommand("verify", "Verify a container");
  verifyCmd->add_option("--public", publicPath, "Public key (DER)")->required();
  verifyCmd->add_option("--in", inPath, "Container")->required();

  auto* showCmd = app.add_subcommand("show", "Verify a container and print its storebag as XML");
  showCmd->add_option("--public", publicPath, "Public key (DER)")->required();
  showCmd->add_option("--in", inPath, "Container")->required();

  CLI11_PARSE(app, argc, argv);

  if (keygenCmd->parsed()) {
    return keygen(privatePath, publicPath, bits);
  }
  if (signCmd->parsed()) {
    return sign(keyPath, inPath, outPath, format);
  }
  if (verifyCmd->parsed()) {
    return check(publicPath, inPath, false);
  }
  return check(publicPath, inPath, true);
}
