#include "platform/rozzel/sha256.h"

#include <openssl/evp.h>

#include <algorithm>
#include <array>
#include <cstdlib>

namespace yomber {

namespace {

constexpr std::size_t kZeroBytes = 64 * 1024;
constexpr std::array<std::byte, kZeroBytes> kZeros{};

/// libcrypto fails here only without memory; going on would name content wrongly.
void check(int result) {
  if (result != 1) std::abort();
}

}  // namespace

struct Sha256::Context {
  EVP_MD_CTX* const context = EVP_MD_CTX_new();
};

Sha256::Sha256() : context_(std::make_unique<Context>()) {
  if (context_->context == nullptr) std::abort();
  check(EVP_DigestInit_ex(context_->context, EVP_sha256(), nullptr));
}

Sha256::~Sha256() { EVP_MD_CTX_free(context_->context); }

void Sha256::update(std::span<const std::byte> bytes) {
  check(EVP_DigestUpdate(context_->context, bytes.data(), bytes.size()));
  size_ += bytes.size();
}

void Sha256::updateZeros(std::uint64_t count) {
  while (count > 0) {
    const auto piece = static_cast<std::size_t>(std::min<std::uint64_t>(count, kZeroBytes));
    update(std::span(kZeros).first(piece));
    count -= piece;
  }
}

RZAsset Sha256::finish() {
  RZAsset asset;
  asset.size = size_;
  check(EVP_DigestFinal_ex(context_->context, asset.hash.data(), nullptr));
  return asset;
}

}  // namespace yomber
