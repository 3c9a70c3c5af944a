#pragma once

// Verification of signed storebag containers.
//
// A container is a property list whose root dictionary holds "signature" and
// "bag", both base64 text (characters outside the base64 alphabet are
// ignored). The decoded "bag" bytes are the storebag proper, signed with RSA
// PKCS#1 v1.5 over their SHA-1 digest. The public key is the client
// framework's "publicKey.der", read afresh at every verification.
//
// A container may carry a second signature over the same bag bytes,
// "signature_ed25519" (base64 of an Ed25519 signature). It is required, and
// checked, only when the framework also holds "publicKeyEd25519.der"; without
// that file it is ignored.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <span>
#include <string>
#include <vector>

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
  // With an Ed25519 key installed:
  BadStrongPublicKey,         // the Ed25519 key file is not an Ed25519 public key
  StrongSignatureMissing,     // no "signature_ed25519" string
  BadStrongSignatureText,     // "signature_ed25519" does not decode
  StrongSignatureMismatch,    // it does not cover the bag bytes with this key
};

// The container's key of the second signature.
inline constexpr const char* kStorebagStrongSignatureKey = "signature_ed25519";

struct StorebagVerification {
  StorebagVerifyStatus status = StorebagVerifyStatus::NotAPropertyList;
  std::string parseError;  // the parser's reason when NotAPropertyList
  std::string verifyError;  // OpenSSL's reason when SignatureMismatch or StrongSignatureMismatch
  Data bagBytes;           // the signed bytes when Verified
};

// Checks a container against a DER public key (SubjectPublicKeyInfo or a
// PKCS#1 RSAPublicKey) and, when `ed25519KeyDER` is given, against that
// Ed25519 key (SubjectPublicKeyInfo) as well: both signatures must then
// verify. An XML container must end with its "</plist>" (white space aside),
// as a binary one must end with its trailer. No logging, no files: the
// building block of parseAndVerifyStorebag, the tool and the fuzz target.
StorebagVerification verifyStorebagContainer(std::span<const std::uint8_t> container,
                                             const std::optional<Data>& publicKeyDER,
                                             const std::optional<Data>& ed25519KeyDER = std::nullopt);

// What a refusal means, for the tool and the log ("the signature does not
// match the bag under this public key (bad signature)").
std::string describeStorebagRefusal(const StorebagVerification& verification);

// The decoded storebag proper of verified bag bytes: a dictionary, or nil
// with `why` ("the bag is an array, not a dictionary", the parser's reason).
Value decodeStorebagBag(const Data& bagBytes, std::string* why = nullptr);

// The framework's RSA key ("publicKey.der"), read afresh; nullopt when it cannot be
// read or is larger than a public key can be.
std::optional<Data> frameworkPublicKey();

// What is wrong with the installed public keys, one line each: no RSA key,
// or one that is not an RSA public key in DER form; an Ed25519 key file that
// cannot be read or holds no Ed25519 key. Each of these refuses every
// storebag (zerithd --check).
std::vector<std::string> storebagKeyProblems();

// The framework's Ed25519 key: nullopt when "publicKeyEd25519.der" does not
// exist (one signature is enough), its bytes otherwise (empty when it cannot
// be read, which refuses every container).
std::optional<Data> frameworkStrongPublicKey();
std::filesystem::path frameworkStrongPublicKeyPath();

// Refusals after a container verified, since the daemon started (`zerith
// status` shows them).
struct StorebagRefusalCounts {
  std::atomic<std::uint64_t> rollbacks{0};          // issued before the newest accepted issue time
  std::atomic<std::uint64_t> missingIssueTime{0};   // no issue time while one is required
  std::atomic<std::uint64_t> unusable{0};           // the bag is no property list dictionary
};
StorebagRefusalCounts& storebagRefusalCounts();

// Where a container came from: the log names it, and a container that was
// already checked when it arrived is not counted again when its bytes are
// read back.
struct StorebagSource {
  std::string where = "the disk cache";
  bool counted = true;
};

// Why the latest storebag fetch of this thread came back empty ("HTTP
// status 404", the TLS error, "signature can not be verified, bad
// signature"), for the error lines that only say that it did; empty when
// nothing failed. fetchStorebagForEnvironmentAndClientType starts afresh.
const std::string& lastStorebagFailure();
void clearStorebagFailure();
// Adds a cause ("; " between several: a failed download, then the unsigned
// fallback refused).
void noteStorebagFailure(const std::string& cause);

// What the daemon makes of the bag of a verified container: used, or refused
// as unusable (not a property list dictionary, an issue time that is no
// date), for having no issue time while one is required, or as a rollback
// (issued before the newest time accepted for `name`). No logging, no
// counting: parseAndVerifyStorebag does both, `zerith-storebag cached` tells.
struct StorebagBagCheck {
  enum class Verdict { Usable, Unusable, MissingIssueTime, Rollback };
  Verdict verdict = Verdict::Usable;
  Value bag;                      // nil when unusable
  std::string unusable;           // the cause when unusable
  std::optional<Date> issued;
  std::optional<Date> newest;     // remembered for `name` (read only when the bag has an issue time)
};
StorebagBagCheck checkStorebagBag(const std::string& name, const Data& bagBytes);

// Parses and verifies a container with the framework's public key(s), then
// checks its bag: a property list dictionary, with an issue time not older
// than the newest one accepted for `name` (and with one at all when the
// defaults require it). When `save` is set, a container that passes is saved
// to the disk cache under `name`; one that verifies but is unusable is never
// kept there. Returns the storebag proper (a dictionary) or nil, logging each
// refusal.
Value parseAndVerifyStorebag(const std::string& name, const Data& data, bool save,
                             const StorebagSource& source = {});

}  // namespace zerith
