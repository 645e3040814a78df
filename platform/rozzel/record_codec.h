#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/rozzel/engine.h"
#include "platform/rozzel/record.h"

namespace yomber {

/// The values of a record as the database keeps them. The first byte is the form's version.
[[nodiscard]] std::string encodeRecordValues(const RZValues& values);

/// Answers the values under `desiredKeys`. Bytes that are not what `encodeRecordValues` makes:
/// StoreFailure with RZErrorStoreDamaged; nothing is read past their end.
[[nodiscard]] RZValues decodeRecordValues(std::string_view bytes, const RZDesiredKeys& desiredKeys);

}  // namespace yomber
