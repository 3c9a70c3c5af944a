#pragma once

// The signing side of storebag containers, for the operator tool, tests and
// benchmarks (the daemon only verifies). A container is a property list
// dictionary {"signature": base64, "bag": base64} whose signature is RSA
// PKCS#1 v1.5 over the SHA-1 digest of the bag bytes.

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

// The DER public key (SubjectPublicKeyInfo) of a PEM private key.
std::optional<Data> storebagPublicKeyFromPrivate(const std::string& privateKeyPEM, std::string* error = nullptr);

// The signature of `bag` under a PEM RSA private key.
std::optional<Data> signStorebagBytes(const std::string& privateKeyPEM, std::span<const std::uint8_t> bag,
                                      std::string* error = nullptr);

// The container dictionary of a signature and the signed bag bytes.
Value makeStorebagContainer(const Data& signature, const Data& bag);

// Sign and wrap in one step: the container as a binary property list.
std::optional<Data> signStorebagContainer(const std::string& privateKeyPEM, const Data& bag,
                                          std::string* error = nullptr);

}  // namespace zerith
