#include "platform/rozzel/engine.h"

namespace yomber {

NSErrorRef RZEngine::importAsset(int descriptor, const RZTransfer& transfer, RZAsset& asset) {
  NSErrorRef error;
  const auto group = newAssetGroup(&error);
  if (!group) return error;
  RZAsset imported;
  if ((error = group->importAsset(descriptor, transfer, imported))) return error;
  if ((error = group->commit())) return error;
  asset = imported;
  return nullptr;
}

NSErrorRef RZEngine::storeAsset(std::span<const std::byte> bytes, RZAsset& asset) {
  NSErrorRef error;
  const auto group = newAssetGroup(&error);
  if (!group) return error;
  const auto writer = group->newWriter(&error);
  if (!writer) return error;
  if ((error = writer->write(bytes))) return error;
  RZAsset written;
  if ((error = writer->finish(written))) return error;
  if ((error = group->commit())) return error;
  asset = written;
  return nullptr;
}

}  // namespace yomber
