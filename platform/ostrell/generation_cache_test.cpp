#include "platform/ostrell/generation_cache.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

TEST(GenerationCache, KeepsWhatWasStored) {
  GenerationCache<int> cache;
  EXPECT_FALSE(cache.value());
  cache.store(cache.generation(), 5);
  EXPECT_EQ(cache.value(), 5);
}

TEST(GenerationCache, AnAnswerFromBeforeAChangeIsNotKept) {
  GenerationCache<int> cache;
  const auto generation = cache.generation();
  cache.empty();
  cache.store(generation, 5);
  EXPECT_FALSE(cache.value());
  cache.store(cache.generation(), 6);
  EXPECT_EQ(cache.value(), 6);
  cache.empty();
  EXPECT_FALSE(cache.value());
}

}  // namespace
}  // namespace yomber
