#pragma once

// Verification of signed storebag containers.
//
// A container is a property list whose root dictionary holds "signature" and
// "bag", both base64 text (characters outside the base64 alphabet are
// ignored). The decoded "bag" bytes are the storebag proper, signed with RSA
// PKCS#1 v1.5 over their SHA-1 digest. The public key is the client
// framework's "publicKey.der", read afresh at every verification.

#include <cstddef>
#include <optional>
#include <span>
#include <string>

#include "platform/PropertyList.h"
#include "platform/Value.h"

namespace zerith {

// Structural limits of a container (a flat dictionary of two strings) and of
// the storebag inside it (a few levels of sections and profiles).
plist::Limits storebagContainerLimits();
plist::Limits storebagBagLimits();

// Why a container was refused.
enum class StorebagVerifyStatus {
  Verified,
  NotAPropertyList,   // the container failed the structural check or the parser
  SignatureMissing,   // no "signature" string
  BadPublicKey,       // the key file is missing or not an RSA public key
  BadSignatureText,   // "signature" does not decode
  BadBagText,         // "bag" is missing or does not decode
  SignatureMismatch,  // the signature does not cover the bag bytes with this key
};

struct StorebagVerification {
  StorebagVerifyStatus status = StorebagVerifyStatus::NotAPropertyList;
  std::string parseError;  // the parser's reason when NotAPropertyList
  std::string verifyError;  // OpenSSL's reason when SignatureMismatch
  Data bagBytes;           // the signed bytes when Verified
};

// Checks a container against a DER public key (SubjectPublicKeyInfo or a
// PKCS#1 RSAPublicKey). No logging, no files: the building block of
// parseAndVerifyStorebag, the tool and the fuzz target.
StorebagVerification verifyStorebagContainer(std::span<const std::uint8_t> container,
                                             const std::optional<Data>& publicKeyDER);

// The decoded storebag proper of verified bag bytes: a dictionary, or nil.
Value decodeStorebagBag(const Data& bagBytes);

// Why the latest storebag fetch of this thread came back empty ("HTTP
// status 404", the TLS error, "signature can not be verified, bad
// signature"), for the error lines that only say that it did; empty when
// nothing failed. fetchStorebagForEnvironmentAndClientType starts afresh.
const std::string& lastStorebagFailure();
void clearStorebagFailure();
// Adds a cause ("; " between several: a failed download, then the unsigned
// fallback refused).
void noteStorebagFailure(const std::string& cause);

// Parses and verifies a container with the framework's public key; when
// `save` is set, a verified container is saved to the disk cache under
// `name`. Returns the storebag proper (a dictionary) or nil, logging each
// refusal.
Value parseAndVerifyStorebag(const std::string& name, const Data& data, bool save);

}  // namespace zerith
