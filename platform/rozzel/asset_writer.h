#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/rozzel/asset_staging.h"
#include "platform/rozzel/engine.h"
#include "platform/rozzel/stream_hasher.h"

namespace yomber {

/// Writes one staged file of a group. See RZAssetWriter.
class StagedWriter final : public RZAssetWriter {
 public:
  StagedWriter(StagedGroup& group, StagedFile file);

  [[nodiscard]] NSErrorRef write(std::span<const std::byte> bytes) override;
  [[nodiscard]] NSErrorRef writeZeros(std::uint64_t count) override;
  [[nodiscard]] NSErrorRef finish(RZAsset& asset) override;

 private:
  /// Does the work unless an earlier one failed, and remembers its failure.
  template <typename Work>
  NSErrorRef attempt(Work&& work);
  void flush();

  StagedGroup& group_;
  StagedFile file_;
  StreamHasher hasher_;
  /// Bytes in the hasher's buffer that are not submitted yet.
  std::size_t buffered_ = 0;
  std::uint64_t offset_ = 0;
  bool ended_ = false;
  NSErrorRef failure_;
};

}  // namespace yomber
