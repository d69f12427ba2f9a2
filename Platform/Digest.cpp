#include "Platform/Digest.h"

#include <openssl/evp.h>

#include <cstdlib>

namespace platform {

namespace {

// Every failure of the EVP calls below is a failure to allocate.
void require(bool succeeded) {
  if (!succeeded) std::abort();
}

}  // namespace

struct SHA256::Context {
  struct Free {
    void operator()(EVP_MD_CTX* md) const { EVP_MD_CTX_free(md); }
  };
  std::unique_ptr<EVP_MD_CTX, Free> md{EVP_MD_CTX_new()};
};

SHA256::SHA256() : context_(std::make_unique<Context>()) {
  require(context_->md && EVP_DigestInit_ex(context_->md.get(), EVP_sha256(), nullptr) == 1);
}

SHA256::~SHA256() = default;

void SHA256::update(const void* bytes, size_t length) {
  if (length != 0) require(EVP_DigestUpdate(context_->md.get(), bytes, length) == 1);
}

SHA256Digest SHA256::finish() {
  SHA256Digest digest{};
  unsigned int length = 0;
  require(EVP_DigestFinal_ex(context_->md.get(), digest.data(), &length) == 1 && length == digest.size() &&
          EVP_DigestInit_ex(context_->md.get(), EVP_sha256(), nullptr) == 1);
  return digest;
}

SHA256Digest sha256(const void* bytes, size_t length) {
  SHA256 hasher;
  hasher.update(bytes, length);
  return hasher.finish();
}

}  // namespace platform
