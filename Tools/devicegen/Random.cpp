#include "Tools/devicegen/Random.h"

#include <cstring>
#include <numeric>

#include "Platform/Foundation/Text.h"

namespace devicegen {
namespace {

uint64_t splitmix64(uint64_t& x) {
  uint64_t z = (x += 0x9E3779B97F4A7C15ULL);
  z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ULL;
  z = (z ^ (z >> 27)) * 0x94D049BB133111EBULL;
  return z ^ (z >> 31);
}

uint64_t rotl(uint64_t x, int k) {
  return (x << k) | (x >> (64 - k));
}

}  // namespace

DeterministicRandom::DeterministicRandom(uint64_t seed) {
  for (uint64_t& word : state_) word = splitmix64(seed);
}

uint64_t DeterministicRandom::next() {
  const uint64_t result = rotl(state_[1] * 5, 7) * 9;
  const uint64_t t = state_[1] << 17;
  state_[2] ^= state_[0];
  state_[3] ^= state_[1];
  state_[1] ^= state_[2];
  state_[0] ^= state_[3];
  state_[2] ^= t;
  state_[3] = rotl(state_[3], 45);
  return result;
}

uint64_t DeterministicRandom::between(uint64_t low, uint64_t high) {
  const uint64_t span = high - low + 1;
  // span == 0 means the whole 64-bit range.
  return span == 0 ? next() : low + next() % span;
}

bool DeterministicRandom::chance(uint64_t numerator, uint64_t denominator) {
  return denominator != 0 && next() % denominator < numerator;
}

void DeterministicRandom::fill(uint8_t* bytes, size_t length) {
  size_t offset = 0;
  while (offset + sizeof(uint64_t) <= length) {
    const uint64_t word = next();
    std::memcpy(bytes + offset, &word, sizeof word);
    offset += sizeof word;
  }
  if (offset < length) {
    const uint64_t word = next();
    std::memcpy(bytes + offset, &word, length - offset);
  }
}

std::string DeterministicRandom::uuid() {
  uint8_t bytes[16];
  fill(bytes, sizeof bytes);
  return platform::uuidString(bytes);
}

std::vector<size_t> DeterministicRandom::permutation(size_t count) {
  std::vector<size_t> order(count);
  std::iota(order.begin(), order.end(), size_t{0});
  // Fisher-Yates with our own generator: std::shuffle's use of the engine is
  // not specified, which would make images differ between standard libraries.
  for (size_t i = count; i > 1; --i) std::swap(order[i - 1], order[between(0, i - 1)]);
  return order;
}

}  // namespace devicegen
