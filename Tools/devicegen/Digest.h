// SHA-256 of generated and migrated files (OpenSSL EVP).
//
// Thread safety: a Sha256 object belongs to one thread; distinct objects are
// independent.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace devicegen {

using Sha256Digest = std::array<uint8_t, 32>;

class Sha256 {
 public:
  Sha256();
  ~Sha256();
  Sha256(const Sha256&) = delete;
  Sha256& operator=(const Sha256&) = delete;

  void update(const void* bytes, size_t length);
  // The digest of everything given since construction or the last finish();
  // the object is ready for a new message afterwards.
  Sha256Digest finish();

 private:
  struct Context;
  Context* context_;  // owned
};

Sha256Digest sha256(const void* bytes, size_t length);
// Lower-case hexadecimal, 64 characters.
std::string hexDigest(const Sha256Digest& digest);

}  // namespace devicegen
