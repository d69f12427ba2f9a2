// DeterministicRandom: the one source of variety in a device image. The same
// seed yields the same sequence on every run and machine (xoshiro256**,
// seeded through splitmix64), so two images made with one seed are identical.
//
// Thread safety: none; one generator belongs to one image being written.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace devicegen {

class DeterministicRandom {
 public:
  explicit DeterministicRandom(uint64_t seed);

  uint64_t next();
  // Uniform in [low, high]; REQUIRES: low <= high.
  uint64_t between(uint64_t low, uint64_t high);
  // True with probability numerator / denominator.
  bool chance(uint64_t numerator, uint64_t denominator);
  // Fills `bytes` with pseudo-random bytes (the content of generated files).
  void fill(uint8_t* bytes, size_t length);
  // A version-4 style UUID in upper case, "XXXXXXXX-XXXX-4XXX-YXXX-XXXXXXXXXXXX".
  std::string uuid();
  // A permutation of 0..count-1.
  std::vector<size_t> permutation(size_t count);

 private:
  uint64_t state_[4];
};

}  // namespace devicegen
