#include "config/StorebagVerify.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <memory>

#include "config/tests/StorebagTestFixture.h"

namespace zerith {
namespace {

using log::Level;
using test::bytes;
using test::sampleStorebag;
using test::signedContainer;
using test::storebagKeys;

// The container's fields, to tamper with.
Value containerFields(const Data& container) { return *plist::decode(plist::bytesOf(container)); }
Data encode(const Value& container) { return plist::encodeBinary(container); }

struct PkeyFree {
  void operator()(EVP_PKEY* k) const { EVP_PKEY_free(k); }
};
using PkeyPtr = std::unique_ptr<EVP_PKEY, PkeyFree>;

PkeyPtr privateKey(const std::string& pem) {
  std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())), BIO_free);
  return PkeyPtr(PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr));
}

// A signature made over a precomputed digest with the low-level signing
// call, as another signer would make it: `md` names the digest algorithm.
Data signDigest(const Data& bag, const EVP_MD* md) {
  auto key = privateKey(storebagKeys().privateKeyPEM);
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int digestLength = 0;
  EVP_Digest(bag.data(), bag.size(), digest, &digestLength, md, nullptr);
  std::unique_ptr<EVP_PKEY_CTX, decltype(&EVP_PKEY_CTX_free)> ctx(EVP_PKEY_CTX_new(key.get(), nullptr),
                                                                   EVP_PKEY_CTX_free);
  EVP_PKEY_sign_init(ctx.get());
  EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING);
  EVP_PKEY_CTX_set_signature_md(ctx.get(), md);
  std::size_t length = 0;
  EVP_PKEY_sign(ctx.get(), nullptr, &length, digest, digestLength);
  Data signature(length);
  EVP_PKEY_sign(ctx.get(), signature.data(), &length, digest, digestLength);
  signature.resize(length);
  return signature;
}

class StorebagVerifyTest : public test::StorebagTest {
 protected:
  // (That a refused container is not saved is the end-to-end storebag tests'.)
  Value verify(const Data& container) { return parseAndVerifyStorebag("ambrel", container, false); }
  bool onlyError(const std::string& line) const {
    std::size_t errors = 0;
    for (const auto& l : logs_.lines()) {
      errors += l.level == Level::Error ? 1 : 0;
    }
    return errors == 1 && logs_.has(Level::Error, line);
  }
};

TEST_F(StorebagVerifyTest, SignedContainerYieldsTheStorebagInBinaryAndXmlForm) {
  const Data container = signedContainer(sampleStorebag());
  EXPECT_EQ(verify(container), sampleStorebag());
  const std::string xml = plist::encodeXml(containerFields(container));
  EXPECT_EQ(verify(bytes(xml)), sampleStorebag());
  EXPECT_FALSE(logs_.contains("fetchStorebagWithName"));
}

TEST_F(StorebagVerifyTest, Base64WithLineBreaksAndForeignCharactersStillVerifies) {
  const Value fields = containerFields(signedContainer(sampleStorebag()));
  auto scatter = [](const std::string& b64) {
    std::string out;
    for (std::size_t i = 0; i < b64.size(); ++i) {
      out += b64[i];
      if (i % 60 == 59) out += "\r\n";
      if (i % 97 == 13) out += " *\xc3\xa9";
    }
    return out;
  };
  const Value scattered(Dictionary{{"signature", scatter(*fields["signature"].string())},
                                   {"bag", scatter(*fields["bag"].string())}});
  EXPECT_EQ(verify(encode(scattered)), sampleStorebag());
}

// The refusal of a signature that does not match, with OpenSSL's reason.
std::string notVerified(const std::string& reason) {
  return "fetchStorebagWithName: Signature can not be verified, " + reason + " (public key '" +
         frameworkPublicKeyPath().string() + "')";
}

TEST_F(StorebagVerifyTest, SignatureOfAPrecomputedSha1DigestVerifiesAndSha256DoesNot) {
  const Data bag = plist::encodeBinary(sampleStorebag());
  EXPECT_EQ(verify(encode(makeStorebagContainer(signDigest(bag, EVP_sha1()), bag))), sampleStorebag());
  EXPECT_TRUE(verify(encode(makeStorebagContainer(signDigest(bag, EVP_sha256()), bag))).isNil());
  EXPECT_TRUE(logs_.contains(notVerified("bad signature")));
}

// What is not a property list, five megabytes of text, or a container
// nested far deeper than any storebag: refused before a field is read.
TEST_F(StorebagVerifyTest, WhatTheParserRefusesIsAMissingSignature) {
  const Value fields = containerFields(signedContainer(sampleStorebag()));
  const Value huge = test::withEntry(fields, "padding", std::string(5u << 20, 'A'));
  std::string nested = "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\">";
  for (int i = 0; i < 200; ++i) nested += "<array>";
  for (int i = 0; i < 200; ++i) nested += "</array>";
  nested += "</plist>";
  const std::pair<Data, std::string> cases[] = {{Data(), ""},
                                                {bytes("not a property list"), ""},
                                                {bytes(std::string("bplist00\x01\x02", 10)), ""},
                                                {encode(huge), "exceeds the limit of 4194304"},
                                                {bytes(nested), "nesting deeper than 8"}};
  for (const auto& [container, why] : cases) {
    SCOPED_TRACE(test::text(container).substr(0, 20));
    logs_.clear();
    EXPECT_TRUE(verify(container).isNil());
    EXPECT_EQ(logs_.count("fetchStorebagWithName: propertyListWithData error "), 1u);
    EXPECT_TRUE(logs_.contains(why));
    EXPECT_TRUE(logs_.has(Level::Error, "fetchStorebagWithName: Signature is missing"));
  }
}

// A container whose fields are missing, of the wrong kind, cut short or
// swapped: refused with exactly one error line, which names the reason.
TEST_F(StorebagVerifyTest, BrokenContainersAreRefusedWithTheirReason) {
  const Value fields = containerFields(signedContainer(sampleStorebag("1.0")));
  const std::string signature = *fields["signature"].string();
  const std::string bag = *fields["bag"].string();
  const std::string otherBag = *containerFields(signedContainer(sampleStorebag("6.6.6")))["bag"].string();
  const std::string missing = "fetchStorebagWithName: Signature is missing";
  const struct {
    const char* name;
    Value container;
    std::string error;
  } rows[] = {
      {"no signature", test::withoutKey(fields, "signature"), missing},
      {"signature as data, not base64 text", test::withEntry(fields, "signature", Data{1, 2, 3}), missing},
      {"root is not a dictionary", Value(Array{fields}), missing},
      {"no bag", test::withoutKey(fields, "bag"), "fetchStorebagWithName: Storebag can not be decoded"},
      {"signature over other bytes", test::withEntry(fields, "bag", otherBag), notVerified("bad signature")},
      // One stray symbol after the last whole group cannot be decoded at all.
      {"signature cut to a stray symbol", test::withEntry(fields, "signature", signature.substr(0, 341)),
       "fetchStorebagWithName: Signature can not be decoded"},
      {"bag cut to a stray symbol", test::withEntry(fields, "bag", bag.substr(0, (bag.size() / 4) * 4 - 4) + "Q"),
       "fetchStorebagWithName: Storebag can not be decoded"},
      // Cut at a group boundary the text decodes, to bytes the signature
      // does not cover.
      {"bag cut at a group", test::withEntry(fields, "bag", bag.substr(0, bag.size() - 8)), notVerified("bad signature")},
      {"signature cut at a group", test::withEntry(fields, "signature", signature.substr(0, 300)),
       notVerified("wrong signature length")},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    logs_.clear();
    EXPECT_TRUE(verify(encode(row.container)).isNil());
    EXPECT_TRUE(onlyError(row.error)) << row.error;
    EXPECT_EQ(logs_.count("fetchStorebagWithName"), 1u);
  }
}

// The key is read afresh at every verification. Only a whole RSA key, in
// either encoding, lets a container through; a missing, cut or other kind of
// key refuses every one with one error line.
TEST_F(StorebagVerifyTest, PublicKeyIsReadAfreshAndOnlyAWholeRsaKeyInEitherFormVerifies) {
  const auto der = [](PkeyPtr key, int (*encode)(const EVP_PKEY*, unsigned char**)) {
    unsigned char* out = nullptr;
    const int length = encode(key.get(), &out);
    Data d(out, out + (length > 0 ? length : 0));
    OPENSSL_free(out);
    return d;
  };
  const Data& spki = storebagKeys().publicKeyDER;
  const unsigned char* p = spki.data();
  installPublicKey(der(PkeyPtr(d2i_PUBKEY(nullptr, &p, static_cast<long>(spki.size()))), i2d_PublicKey));
  const Data container = signedContainer(sampleStorebag());
  EXPECT_EQ(verify(container), sampleStorebag()) << "RSAPublicKey form";
  installPublicKey(test::otherStorebagKeys().publicKeyDER);
  EXPECT_TRUE(verify(container).isNil());
  EXPECT_FALSE(verify(signedContainer(sampleStorebag(), test::otherStorebagKeys())).isNil());

  const std::pair<const char*, std::optional<Data>> refused[] = {
      {"missing", std::nullopt},
      {"truncated", Data(spki.begin(), spki.end() - 1)},
      {"not RSA", der(PkeyPtr(EVP_EC_gen("P-256")), i2d_PUBKEY)}};
  for (const auto& [name, key] : refused) {
    logs_.clear();
    if (key) {
      installPublicKey(*key);
    } else {
      std::filesystem::remove(frameworkPublicKeyPath());
    }
    EXPECT_TRUE(verify(container).isNil()) << name;
    EXPECT_TRUE(onlyError("fetchStorebagWithName: Could not create an RSA public key from '" +
                          frameworkPublicKeyPath().string() + "'"))
        << name;
  }
}

}  // namespace
}  // namespace zerith
