#include "Tools/devicegen/Digest.h"

#include <openssl/evp.h>

#include <cstdlib>

namespace devicegen {

struct Sha256::Context {
  EVP_MD_CTX* md = nullptr;
};

Sha256::Sha256() : context_(new Context) {
  context_->md = EVP_MD_CTX_new();
  // Without a context or the algorithm nothing this tool computes would be
  // trustworthy; there is no sensible way to go on.
  if (!context_->md || EVP_DigestInit_ex(context_->md, EVP_sha256(), nullptr) != 1) std::abort();
}

Sha256::~Sha256() {
  EVP_MD_CTX_free(context_->md);
  delete context_;
}

void Sha256::update(const void* bytes, size_t length) {
  if (length != 0 && EVP_DigestUpdate(context_->md, bytes, length) != 1) std::abort();
}

Sha256Digest Sha256::finish() {
  Sha256Digest digest{};
  unsigned int length = 0;
  if (EVP_DigestFinal_ex(context_->md, digest.data(), &length) != 1 || length != digest.size() ||
      EVP_DigestInit_ex(context_->md, EVP_sha256(), nullptr) != 1) {
    std::abort();
  }
  return digest;
}

Sha256Digest sha256(const void* bytes, size_t length) {
  Sha256 hasher;
  hasher.update(bytes, length);
  return hasher.finish();
}

std::string hexDigest(const Sha256Digest& digest) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string text;
  text.reserve(digest.size() * 2);
  for (uint8_t byte : digest) {
    text += kHex[byte >> 4];
    text += kHex[byte & 0x0F];
  }
  return text;
}

}  // namespace devicegen
