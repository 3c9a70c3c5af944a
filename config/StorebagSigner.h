#pragma once

// The signing side of storebag containers, for the operator tool, tests and
// benchmarks (the daemon only verifies). A container is a property list
// dictionary {"signature": base64, "bag": base64} whose signature is RSA
// PKCS#1 v1.5 over the SHA-1 digest of the bag bytes; it may also carry
// "signature_ed25519", an Ed25519 signature over the same bytes.

#include <optional>
#include <span>
#include <string>

#include "platform/Value.h"

namespace zerith {

struct StorebagKeyPair {
  std::string privateKeyPEM;  // PKCS#8, unencrypted
  Data publicKeyDER;          // SubjectPublicKeyInfo
};

// A fresh RSA key pair; nullopt (with `error`) when key generation fails.
std::optional<StorebagKeyPair> generateStorebagKeyPair(int bits = 2048, std::string* error = nullptr);
// A fresh Ed25519 key pair for the second signature.
std::optional<StorebagKeyPair> generateStorebagEd25519KeyPair(std::string* error = nullptr);

// The DER public key (SubjectPublicKeyInfo) of a PEM private key (RSA or
// Ed25519).
std::optional<Data> storebagPublicKeyFromPrivate(const std::string& privateKeyPEM, std::string* error = nullptr);

// The signature of `bag` under a PEM private key: RSA PKCS#1 v1.5 over SHA-1
// for an RSA key, Ed25519 for an Ed25519 key. `ed25519` says which the key
// must be.
std::optional<Data> signStorebagBytes(const std::string& privateKeyPEM, std::span<const std::uint8_t> bag,
                                      std::string* error = nullptr, bool ed25519 = false);

// The container dictionary of a signature, the signed bag bytes and, when
// given, the Ed25519 signature of the same bytes.
Value makeStorebagContainer(const Data& signature, const Data& bag, const std::optional<Data>& ed25519Signature = {});

// The bag bytes (any property-list form, a dictionary) with "issue_time" set
// to `issued`, as a binary property list; nullopt (with `error`) when the
// bytes are not a property list dictionary.
std::optional<Data> stampStorebagIssueTime(const Data& bag, Date issued, std::string* error = nullptr);

// Sign and wrap in one step: the container as a binary property list, with
// the Ed25519 signature too when `ed25519KeyPEM` is given. The bag bytes are
// signed as they are (stamp them first).
std::optional<Data> signStorebagContainer(const std::string& privateKeyPEM, const Data& bag,
                                          std::string* error = nullptr,
                                          const std::optional<std::string>& ed25519KeyPEM = std::nullopt);

}  // namespace zerith
