// SHA-256 (OpenSSL EVP), incremental or of one buffer.
//
// OpenSSL fails here only when it cannot allocate its context, which, like a
// failed `new`, ends the process.
//
// Thread safety: a SHA256 object belongs to one thread; distinct objects are
// independent.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>

namespace platform {

using SHA256Digest = std::array<uint8_t, 32>;

class SHA256 {
 public:
  SHA256();
  ~SHA256();
  SHA256(const SHA256&) = delete;
  SHA256& operator=(const SHA256&) = delete;

  void update(const void* bytes, size_t length);
  // The digest of everything given since construction or the last finish();
  // the object is ready for a new message afterwards.
  SHA256Digest finish();

 private:
  struct Context;
  std::unique_ptr<Context> context_;
};

SHA256Digest sha256(const void* bytes, size_t length);

}  // namespace platform
