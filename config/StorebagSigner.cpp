#include "platform/OpenSSLHandles.h"
#include "config/StorebagSigner.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <memory>

#include "config/StorebagIssueTimes.h"
#include "config/StorebagVerify.h"
#include "platform/Crypto.h"
#include "platform/PropertyList.h"

namespace zerith {

namespace {


// The reason OpenSSL gives for its last failure (clears its queue).
std::string failure(const char* what) {
  std::string out = what;
  if (const unsigned long code = ERR_get_error(); code != 0) {
    char buf[256];
    ERR_error_string_n(code, buf, sizeof buf);
    out += ": ";
    out += buf;
  }
  ERR_clear_error();
  return out;
}

bool fail(std::string* error, const char* what) {
  const std::string why = failure(what);
  if (error) {
    *error = why;
  }
  return false;
}

std::optional<Data> publicDER(EVP_PKEY* key, std::string* error);

// A PEM private key of the type named ("RSA", "ED25519"), or of either when
// `type` is null.
ossl::PkeyPtr readPrivateKey(const std::string& pem, std::string* error, const char* type = "RSA") {
  ossl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  ossl::PkeyPtr key(bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr) : nullptr);
  if (!key) {
    fail(error, "not a PEM private key");
    return nullptr;
  }
  const bool rsa = EVP_PKEY_is_a(key.get(), "RSA") == 1;
  const bool ed25519 = EVP_PKEY_is_a(key.get(), "ED25519") == 1;
  if (type ? EVP_PKEY_is_a(key.get(), type) != 1 : !(rsa || ed25519)) {
    fail(error, type && std::string_view(type) == "ED25519" ? "the private key is not an Ed25519 key"
                                                             : "the private key is not an RSA key");
    return nullptr;
  }
  return key;
}

std::optional<StorebagKeyPair> keyPairOf(EVP_PKEY* key, std::string* error) {
  ossl::BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || PEM_write_bio_PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    fail(error, "cannot encode the private key");
    return std::nullopt;
  }
  char* pem = nullptr;
  const long pemLength = BIO_get_mem_data(bio.get(), &pem);
  auto der = publicDER(key, error);
  if (!der) {
    return std::nullopt;
  }
  return StorebagKeyPair{std::string(pem, static_cast<std::size_t>(pemLength)), std::move(*der)};
}

std::optional<Data> publicDER(EVP_PKEY* key, std::string* error) {
  const int length = i2d_PUBKEY(key, nullptr);
  if (length <= 0) {
    fail(error, "cannot encode the public key");
    return std::nullopt;
  }
  Data der(static_cast<std::size_t>(length));
  unsigned char* p = der.data();
  i2d_PUBKEY(key, &p);
  return der;
}

}  // namespace

std::optional<StorebagKeyPair> generateStorebagKeyPair(int bits, std::string* error) {
  ossl::PkeyPtr key(EVP_RSA_gen(static_cast<unsigned>(bits)));
  if (!key) {
    fail(error, "RSA key generation failed");
    return std::nullopt;
  }
  return keyPairOf(key.get(), error);
}

std::optional<StorebagKeyPair> generateStorebagEd25519KeyPair(std::string* error) {
  ossl::PkeyPtr key(EVP_PKEY_Q_keygen(nullptr, nullptr, "ED25519"));
  if (!key) {
    fail(error, "Ed25519 key generation failed");
    return std::nullopt;
  }
  return keyPairOf(key.get(), error);
}

std::optional<Data> storebagPublicKeyFromPrivate(const std::string& privateKeyPEM, std::string* error) {
  ossl::PkeyPtr key = readPrivateKey(privateKeyPEM, error, nullptr);
  return key ? publicDER(key.get(), error) : std::nullopt;
}

std::optional<Data> signStorebagBytes(const std::string& privateKeyPEM, std::span<const std::uint8_t> bag,
                                      std::string* error, bool ed25519) {
  ossl::PkeyPtr key = readPrivateKey(privateKeyPEM, error, ed25519 ? "ED25519" : "RSA");
  if (!key) {
    return std::nullopt;
  }
  ossl::MdCtxPtr ctx(EVP_MD_CTX_new());
  EVP_PKEY_CTX* pctx = nullptr;  // owned by ctx
  std::size_t length = 0;
  // Ed25519 hashes by itself: no digest, no padding.
  if (!ctx || EVP_DigestSignInit(ctx.get(), &pctx, ed25519 ? nullptr : EVP_sha1(), nullptr, key.get()) != 1 ||
      (!ed25519 && EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PADDING) != 1) ||
      EVP_DigestSign(ctx.get(), nullptr, &length, bag.data(), bag.size()) != 1) {
    fail(error, "signing failed");
    return std::nullopt;
  }
  Data signature(length);
  if (EVP_DigestSign(ctx.get(), signature.data(), &length, bag.data(), bag.size()) != 1) {
    fail(error, "signing failed");
    return std::nullopt;
  }
  signature.resize(length);
  return signature;
}

Value makeStorebagContainer(const Data& signature, const Data& bag, const std::optional<Data>& ed25519Signature) {
  Dictionary container{{"signature", crypto::base64Encode(signature)}, {"bag", crypto::base64Encode(bag)}};
  if (ed25519Signature) {
    container.set(kStorebagStrongSignatureKey, crypto::base64Encode(*ed25519Signature));
  }
  return Value(std::move(container));
}

std::optional<Data> stampStorebagIssueTime(const Data& bag, Date issued, std::string* error) {
  std::string why;
  const auto parsed = plist::decode(plist::bytesOf(bag), storebagBagLimits(), &why);
  if (!parsed || !parsed->isDict()) {
    if (error) {
      *error = parsed ? "not a property list dictionary" : "not a property list: " + why;
    }
    return std::nullopt;
  }
  Dictionary stamped = parsed->dictCopy();
  stamped.set(kStorebagIssueTimeKey, Value(issued));
  return plist::encodeBinary(Value(std::move(stamped)));
}

std::optional<Data> signStorebagContainer(const std::string& privateKeyPEM, const Data& bag, std::string* error,
                                          const std::optional<std::string>& ed25519KeyPEM) {
  auto signature = signStorebagBytes(privateKeyPEM, bag, error);
  if (!signature) {
    return std::nullopt;
  }
  std::optional<Data> strong;
  if (ed25519KeyPEM) {
    strong = signStorebagBytes(*ed25519KeyPEM, bag, error, /*ed25519=*/true);
    if (!strong) {
      return std::nullopt;
    }
  }
  return plist::encodeBinary(makeStorebagContainer(*signature, bag, strong));
}

}  // namespace zerith
