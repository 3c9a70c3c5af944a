#include "platform/OpenSSLHandles.h"
#include "config/StorebagVerify.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/x509.h>

#include <memory>

#include <fmt/format.h>

#include "config/StorebagDiskCache.h"
#include "platform/Crypto.h"
#include "platform/FileUtil.h"
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
    // The first entry names the cause; later ones only say where it passed.
    const unsigned long code = ERR_peek_error();
    const char* text = code != 0 ? ERR_reason_error_string(code) : nullptr;
    reason = text ? text : "the signature does not match the storebag for this public key";
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
                                             const std::optional<Data>& publicKeyDER) {
  StorebagVerification result;
  const auto parsed = plist::decode(container, storebagContainerLimits(), &result.parseError);
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
  if (!verifySha1Rsa(key.get(), *signature, *bag, result.verifyError)) {
    result.status = StorebagVerifyStatus::SignatureMismatch;
    return result;
  }
  result.status = StorebagVerifyStatus::Verified;
  result.bagBytes = std::move(*bag);
  return result;
}

Value decodeStorebagBag(const Data& bagBytes) {
  auto bag = plist::decode(plist::bytesOf(bagBytes), storebagBagLimits());
  if (!bag || !bag->isDict()) {
    return Value();
  }
  return *bag;
}

Value parseAndVerifyStorebag(const std::string& name, const Data& data, bool save) {
  const auto keyPath = frameworkPublicKeyPath();
  const auto verification = verifyStorebagContainer(plist::bytesOf(data), file::readAll(keyPath, kMaxPublicKeyBytes));
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
    case StorebagVerifyStatus::Verified: break;
  }
  if (save && saveStorebagToDisk(name, data)) {
    configLogger().info("fetchStorebagWithName: storebag '{}' has been saved to disk cache", name);
  }
  return decodeStorebagBag(verification.bagBytes);
}

}  // namespace zerith
