#pragma once

#include <string>

#include <nlohmann/json_fwd.hpp>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"

namespace yomber {

/// How a command prints.
enum class OutputForm { Short, Long, Json };

/// One line for one item, without the line's end: the name; or kind, size, date, identifier and
/// name; or a JSON object. Bytes of a name that a terminal would act on, or that are not UTF-8, are
/// shown as
/// "\xNN" in the first two forms; in JSON a name that is not UTF-8 comes as "name_base64" instead
/// of "name".
[[nodiscard]] std::string itemLine(const ItemFields& item, OutputForm form);

[[nodiscard]] nlohmann::ordered_json itemJson(const ItemFields& item);
[[nodiscard]] nlohmann::ordered_json errorJson(const NSErrorRef& error);

/// JSON on one line, without the line's end; bytes that are not UTF-8 are replaced.
[[nodiscard]] std::string jsonLine(const nlohmann::ordered_json& json);

/// A name, or a text with names in it, fit for a terminal.
[[nodiscard]] std::string printableName(const std::string& name);

/// "4.2 KB": three significant digits at most, powers of 1000.
[[nodiscard]] std::string readableSize(std::uint64_t bytes);

}  // namespace yomber
