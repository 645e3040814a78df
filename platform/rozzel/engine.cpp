#include "platform/rozzel/engine.h"

namespace yomber {

NSErrorRef RZEngine::importAsset(int descriptor, const RZTransfer& transfer, RZAsset& asset) {
  NSErrorRef error;
  const auto group = newAssetGroup(&error);
  if (!group) return error;
  RZAsset imported;
  error = group->importAsset(descriptor, transfer, imported);
  if (!error) error = group->commit();
  if (error) return error;
  asset = imported;
  return nullptr;
}

NSErrorRef RZEngine::storeAsset(std::span<const std::byte> bytes, RZAsset& asset) {
  NSErrorRef error;
  const auto group = newAssetGroup(&error);
  if (!group) return error;
  const auto writer = group->newWriter(&error);
  if (!writer) return error;
  RZAsset written;
  error = writer->write(bytes);
  if (!error) error = writer->finish(written);
  if (!error) error = group->commit();
  if (error) return error;
  asset = written;
  return nullptr;
}

}  // namespace yomber
