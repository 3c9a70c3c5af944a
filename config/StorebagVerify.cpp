#include "platform/OpenSSLHandles.h"
#include "config/StorebagVerify.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/x509.h>

#include <memory>

#include <fmt/format.h>

#include "config/StorebagDiskCache.h"
#include "config/StorebagIssueTimes.h"
#include "config/StorebagLint.h"
#include "platform/Crypto.h"
#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "config/ConfigLog.h"
#include "zerith/ZerithBundle.h"

namespace zerith {

namespace {


// A DER key file is a few hundred bytes; anything far larger is not one.
constexpr std::size_t kMaxPublicKeyBytes = 64u << 10;

// An RSA public key from DER: SubjectPublicKeyInfo (what `openssl rsa
// -pubout` writes) or a bare PKCS#1 RSAPublicKey. The whole input must be
// the key.
ossl::PkeyPtr rsaPublicKeyFromDER(const Data& der) {
  if (der.empty() || der.size() > kMaxPublicKeyBytes) {
    return nullptr;
  }
  const long length = static_cast<long>(der.size());
  const unsigned char* p = der.data();
  ossl::PkeyPtr key(d2i_PUBKEY(nullptr, &p, length));
  if (!key || p != der.data() + der.size()) {
    p = der.data();
    key.reset(d2i_PublicKey(EVP_PKEY_RSA, nullptr, &p, length));
    if (key && p != der.data() + der.size()) {
      key.reset();
    }
  }
  ERR_clear_error();  // failed attempts leave entries on this thread's queue
  if (key && EVP_PKEY_is_a(key.get(), "RSA") != 1) {
    key.reset();
  }
  return key;
}

// An Ed25519 public key from DER (SubjectPublicKeyInfo, what `openssl pkey
// -pubout -outform DER` writes); the whole input must be the key.
ossl::PkeyPtr ed25519PublicKeyFromDER(const Data& der) {
  if (der.empty() || der.size() > kMaxPublicKeyBytes) {
    return nullptr;
  }
  const unsigned char* p = der.data();
  ossl::PkeyPtr key(d2i_PUBKEY(nullptr, &p, static_cast<long>(der.size())));
  ERR_clear_error();
  if (!key || p != der.data() + der.size() || EVP_PKEY_is_a(key.get(), "ED25519") != 1) {
    return nullptr;
  }
  return key;
}

// The first entry of OpenSSL's queue names the cause; later ones only say
// where it passed.
std::string opensslReason() {
  const unsigned long code = ERR_peek_error();
  const char* text = code != 0 ? ERR_reason_error_string(code) : nullptr;
  ERR_clear_error();
  return text ? text : "the signature does not match the storebag for this public key";
}

// Ed25519 over `message` itself (the scheme hashes internally).
bool verifyEd25519(EVP_PKEY* key, const Data& signature, const Data& message, std::string& reason) {
  ERR_clear_error();
  ossl::MdCtxPtr ctx(EVP_MD_CTX_new());
  const bool ok = ctx && EVP_DigestVerifyInit(ctx.get(), nullptr, nullptr, nullptr, key) == 1 &&
                  EVP_DigestVerify(ctx.get(), signature.data(), signature.size(), message.data(), message.size()) == 1;
  if (!ok) {
    reason = opensslReason();
  }
  ERR_clear_error();
  return ok;
}

// An XML container ends with its closing tag: what follows it (other than
// white space) is refused, as bytes after a binary list's trailer are.
std::optional<std::string> xmlTrailingBytes(std::span<const std::uint8_t> container) {
  if (plist::looksBinary(container)) {
    return std::nullopt;
  }
  const std::string_view text(reinterpret_cast<const char*>(container.data()), container.size());
  constexpr std::string_view kClose = "</plist>";
  const auto close = text.find(kClose);  // the root's: text inside the list is escaped
  if (close == std::string_view::npos) {
    return std::nullopt;  // the parser says what is wrong
  }
  const auto rest = text.substr(close + kClose.size());
  if (rest.find_first_not_of(" \t\r\n") == std::string_view::npos) {
    return std::nullopt;
  }
  return fmt::format("{} bytes follow the closing </plist>", rest.size());
}

// RSA PKCS#1 v1.5 over the SHA-1 digest of `message`. On failure `reason`
// gets OpenSSL's reason ("bad signature", "wrong signature length", ...).
bool verifySha1Rsa(EVP_PKEY* key, const Data& signature, const Data& message, std::string& reason) {
  ERR_clear_error();
  ossl::MdCtxPtr ctx(EVP_MD_CTX_new());
  EVP_PKEY_CTX* pctx = nullptr;  // owned by ctx
  bool ok = ctx && EVP_DigestVerifyInit(ctx.get(), &pctx, EVP_sha1(), nullptr, key) == 1 &&
            EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PADDING) == 1 &&
            EVP_DigestVerify(ctx.get(), signature.data(), signature.size(), message.data(), message.size()) == 1;
  if (!ok) {
    reason = opensslReason();
  }
  ERR_clear_error();
  return ok;
}

thread_local std::string tLastFailure;

}  // namespace

const std::string& lastStorebagFailure() { return tLastFailure; }

void clearStorebagFailure() { tLastFailure.clear(); }

void noteStorebagFailure(const std::string& cause) {
  // A thread that never clears (a transport queue) keeps no more than this.
  constexpr std::size_t kMaxFailureText = 2048;
  if (tLastFailure.size() + cause.size() < kMaxFailureText) {
    tLastFailure += (tLastFailure.empty() ? "" : "; ") + cause;
  }
}

plist::Limits storebagContainerLimits() {
  return plist::Limits{kMaxStorebagContainerBytes, 8, 1024};
}

plist::Limits storebagBagLimits() {
  // The bag is base64 inside the container: at most three quarters of it.
  return plist::Limits{kMaxStorebagContainerBytes / 4 * 3, 32, 1u << 18};
}

StorebagVerification verifyStorebagContainer(std::span<const std::uint8_t> container,
                                             const std::optional<Data>& publicKeyDER,
                                             const std::optional<Data>& ed25519KeyDER) {
  StorebagVerification result;
  auto parsed = plist::decode(container, storebagContainerLimits(), &result.parseError);
  if (parsed) {
    if (auto trailing = xmlTrailingBytes(container)) {
      parsed.reset();
      result.parseError = std::move(*trailing);
    }
  }
  if (!parsed) {
    result.status = StorebagVerifyStatus::NotAPropertyList;
    return result;
  }
  const Value signatureValue = (*parsed)["signature"];
  const auto* signatureText = signatureValue.string();
  if (!signatureText) {
    result.status = StorebagVerifyStatus::SignatureMissing;
    return result;
  }
  ossl::PkeyPtr key = publicKeyDER ? rsaPublicKeyFromDER(*publicKeyDER) : nullptr;
  if (!key) {
    result.status = StorebagVerifyStatus::BadPublicKey;
    return result;
  }
  const auto signature = crypto::base64Decode(*signatureText);
  if (!signature) {
    result.status = StorebagVerifyStatus::BadSignatureText;
    return result;
  }
  const Value bagValue = (*parsed)["bag"];
  const auto* bagText = bagValue.string();
  auto bag = bagText ? crypto::base64Decode(*bagText) : std::nullopt;
  if (!bag) {
    result.status = StorebagVerifyStatus::BadBagText;
    return result;
  }
  if (ed25519KeyDER) {
    // The strong signature first: with its key installed a container that
    // lacks it is refused whatever its RSA signature says.
    ossl::PkeyPtr strongKey = ed25519PublicKeyFromDER(*ed25519KeyDER);
    if (!strongKey) {
      result.status = StorebagVerifyStatus::BadStrongPublicKey;
      return result;
    }
    const Value strongValue = (*parsed)[kStorebagStrongSignatureKey];
    const auto* strongText = strongValue.string();
    if (!strongText) {
      result.status = StorebagVerifyStatus::StrongSignatureMissing;
      return result;
    }
    const auto strongSignature = crypto::base64Decode(*strongText);
    if (!strongSignature) {
      result.status = StorebagVerifyStatus::BadStrongSignatureText;
      return result;
    }
    if (!verifyEd25519(strongKey.get(), *strongSignature, *bag, result.verifyError)) {
      result.status = StorebagVerifyStatus::StrongSignatureMismatch;
      return result;
    }
  }
  if (!verifySha1Rsa(key.get(), *signature, *bag, result.verifyError)) {
    result.status = StorebagVerifyStatus::SignatureMismatch;
    return result;
  }
  result.status = StorebagVerifyStatus::Verified;
  result.bagBytes = std::move(*bag);
  return result;
}

std::string describeStorebagRefusal(const StorebagVerification& v) {
  using S = StorebagVerifyStatus;
  switch (v.status) {
    case S::Verified: return "verified";
    case S::NotAPropertyList: return "the container is not a property list: " + v.parseError;
    case S::SignatureMissing: return "the container has no \"signature\" string";
    case S::BadPublicKey: return "the public key is not an RSA public key in DER form";
    case S::BadSignatureText: return "\"signature\" is not valid base64";
    case S::BadBagText: return "\"bag\" is missing or not valid base64";
    case S::SignatureMismatch: return "the signature does not match the bag under this public key (" + v.verifyError + ")";
    case S::BadStrongPublicKey: return "the Ed25519 public key is not an Ed25519 public key in DER form";
    case S::StrongSignatureMissing:
      return fmt::format("the container has no \"{}\" string", kStorebagStrongSignatureKey);
    case S::BadStrongSignatureText: return fmt::format("\"{}\" is not valid base64", kStorebagStrongSignatureKey);
    case S::StrongSignatureMismatch:
      return "the Ed25519 signature does not match the bag under this public key (" + v.verifyError + ")";
  }
  return "unknown failure";
}

Value decodeStorebagBag(const Data& bagBytes, std::string* why) {
  std::string error;
  auto bag = plist::decode(plist::bytesOf(bagBytes), storebagBagLimits(), &error);
  if (!bag) {
    if (why) {
      *why = "the bag is not a property list (" + error + ")";
    }
    return Value();
  }
  if (!bag->isDict()) {
    if (why) {
      *why = fmt::format("the bag is {}, not a dictionary", bag->isArray() ? "an array" : "a single value");
    }
    return Value();
  }
  return *bag;
}

std::vector<std::string> storebagKeyProblems() {
  std::vector<std::string> problems;
  const auto keyPath = frameworkPublicKeyPath().string();
  if (const auto key = frameworkPublicKey(); !key) {
    problems.push_back(fmt::format("no storebag public key can be read at {}: every storebag is refused", keyPath));
  } else if (!rsaPublicKeyFromDER(*key)) {
    problems.push_back(
        fmt::format("{} is not an RSA public key in DER form: every storebag is refused", keyPath));
  }
  const auto strongPath = frameworkStrongPublicKeyPath().string();
  if (const auto strongKey = frameworkStrongPublicKey(); strongKey && !ed25519PublicKeyFromDER(*strongKey)) {
    problems.push_back(fmt::format("{} cannot be read or is not an Ed25519 public key in DER form: every storebag is "
                                   "refused",
                                   strongPath));
  }
  return problems;
}

std::optional<Data> frameworkPublicKey() { return file::readAll(frameworkPublicKeyPath(), kMaxPublicKeyBytes); }

std::filesystem::path frameworkStrongPublicKeyPath() { return paths::frameworkResourceDir() / "publicKeyEd25519.der"; }

std::optional<Data> frameworkStrongPublicKey() {
  const auto path = frameworkStrongPublicKeyPath();
  std::error_code ec;
  if (!std::filesystem::exists(path, ec) && !ec) {
    return std::nullopt;
  }
  return file::readAll(path, kMaxPublicKeyBytes).value_or(Data());
}

StorebagRefusalCounts& storebagRefusalCounts() {
  static StorebagRefusalCounts counts;
  return counts;
}

StorebagBagCheck checkStorebagBag(const std::string& name, const Data& bagBytes) {
  StorebagBagCheck check;
  check.bag = decodeStorebagBag(bagBytes, &check.unusable);
  if (!check.bag.isNil()) {
    check.issued = storebagIssueTime(check.bag, &check.unusable);
  }
  if (!check.unusable.empty()) {
    check.verdict = StorebagBagCheck::Verdict::Unusable;
    check.bag = Value();
    return check;
  }
  if (!check.issued) {
    if (storebagIssueTimeRequired()) {
      check.verdict = StorebagBagCheck::Verdict::MissingIssueTime;
    }
    return check;
  }
  check.newest = rememberedStorebagIssueTime(name);
  if (check.newest && *check.issued < *check.newest) {
    check.verdict = StorebagBagCheck::Verdict::Rollback;
  }
  return check;
}

namespace {

// The bag of a verified container, or nil when it must not be used: logged,
// noted and counted.
Value usableBag(const std::string& name, const Data& bagBytes, const StorebagSource& source) {
  StorebagBagCheck check = checkStorebagBag(name, bagBytes);
  switch (check.verdict) {
    case StorebagBagCheck::Verdict::Usable: return std::move(check.bag);
    case StorebagBagCheck::Verdict::Unusable:
      configLogger().error("fetchStorebagWithName: storebag '{}' from {} is signed but unusable: {}", name,
                           source.where, check.unusable);
      noteStorebagFailure("the signed storebag is unusable: " + check.unusable);
      if (source.counted) {
        ++storebagRefusalCounts().unusable;
      }
      return Value();
    case StorebagBagCheck::Verdict::MissingIssueTime:
      configLogger().error("fetchStorebagWithName: storebag '{}' from {} has no \"{}\" and {} is set: refused", name,
                           source.where, kStorebagIssueTimeKey, kRequireStorebagIssueTimeKey);
      noteStorebagFailure(fmt::format("the storebag has no \"{}\"", kStorebagIssueTimeKey));
      if (source.counted) {
        ++storebagRefusalCounts().missingIssueTime;
      }
      return Value();
    case StorebagBagCheck::Verdict::Rollback:
      configLogger().error(
          "fetchStorebagWithName: storebag '{}' from {} was issued at {}, before {}, the newest issue time accepted for "
          "it: refused as a rollback",
          name, source.where, describeIssueTime(*check.issued), describeIssueTime(*check.newest));
      noteStorebagFailure(fmt::format("the storebag was issued at {}, before the newest accepted {}",
                                      describeIssueTime(*check.issued), describeIssueTime(*check.newest)));
      if (source.counted) {
        ++storebagRefusalCounts().rollbacks;
      }
      return Value();
  }
  return Value();
}

}  // namespace

Value parseAndVerifyStorebag(const std::string& name, const Data& data, bool save, const StorebagSource& source) {
  const auto keyPath = frameworkPublicKeyPath();
  const auto strongKey = frameworkStrongPublicKey();
  const auto verification =
      verifyStorebagContainer(plist::bytesOf(data), frameworkPublicKey(), strongKey);
  const auto strongKeyPath = frameworkStrongPublicKeyPath().string();
  switch (verification.status) {
    case StorebagVerifyStatus::NotAPropertyList:
      configLogger().error("fetchStorebagWithName: propertyListWithData error {}", verification.parseError);
      configLogger().error("fetchStorebagWithName: Signature is missing");
      noteStorebagFailure("the storebag is not a property list (" + verification.parseError + ")");
      return Value();
    case StorebagVerifyStatus::SignatureMissing:
      configLogger().error("fetchStorebagWithName: Signature is missing");
      noteStorebagFailure("the storebag's signature is missing");
      return Value();
    case StorebagVerifyStatus::BadPublicKey:
      configLogger().error("fetchStorebagWithName: Could not create an RSA public key from '{}'", keyPath.string());
      noteStorebagFailure("no RSA public key in '" + keyPath.string() + "'");
      return Value();
    case StorebagVerifyStatus::BadSignatureText:
      configLogger().error("fetchStorebagWithName: Signature can not be decoded");
      noteStorebagFailure("the storebag's signature can not be decoded");
      return Value();
    case StorebagVerifyStatus::BadBagText:
      configLogger().error("fetchStorebagWithName: Storebag can not be decoded");
      noteStorebagFailure("the storebag's bag can not be decoded");
      return Value();
    case StorebagVerifyStatus::SignatureMismatch:
      // The key and the storebag do not belong together (a replaced key,
      // another signer, altered bytes): the reason is OpenSSL's.
      configLogger().error("fetchStorebagWithName: Signature can not be verified, {} (public key '{}')",
                           verification.verifyError, keyPath.string());
      noteStorebagFailure("signature can not be verified, " + verification.verifyError + " (public key '" +
                          keyPath.string() + "')");
      return Value();
    case StorebagVerifyStatus::BadStrongPublicKey:
      configLogger().error("fetchStorebagWithName: Could not create an Ed25519 public key from '{}'", strongKeyPath);
      noteStorebagFailure("no Ed25519 public key in '" + strongKeyPath + "'");
      return Value();
    case StorebagVerifyStatus::StrongSignatureMissing:
    case StorebagVerifyStatus::BadStrongSignatureText:
    case StorebagVerifyStatus::StrongSignatureMismatch: {
      // The Ed25519 key is installed: its signature is required.
      const std::string why = describeStorebagRefusal(verification) + " (public key '" + strongKeyPath + "')";
      configLogger().error("fetchStorebagWithName: storebag '{}' from {} refused: {}", name, source.where, why);
      noteStorebagFailure(why);
      return Value();
    }
    case StorebagVerifyStatus::Verified: break;
  }
  Value bag = usableBag(name, verification.bagBytes, source);
  if (bag.isNil()) {
    return bag;
  }
  if (save && saveStorebagToDisk(name, data)) {
    configLogger().info("fetchStorebagWithName: storebag '{}' has been saved to disk cache", name);
  }
  // What the daemon will ignore in the bag or never enable, said once as the
  // bag arrives from the server rather than session by session.
  for (const auto& finding : save ? lintStorebag(bag) : std::vector<StorebagFinding>{}) {
    if (finding.error) {
      configLogger().error("fetchStorebagWithName: storebag '{}': {}", name, finding.describe());
    } else {
      configLogger().info("fetchStorebagWithName: storebag '{}': {}", name, finding.describe());
    }
  }
  // A bag's time is remembered as it arrives from the server; reading the
  // disk copy back does not raise it again, so that the operator's forgetting
  // lets an older bag replace that copy.
  if (const auto issued = save ? storebagIssueTime(bag, nullptr) : std::nullopt) {
    rememberStorebagIssueTime(name, *issued);
  }
  return bag;
}

}  // namespace zerith
