#pragma once

#include <string>
#include <string_view>

namespace yomber {

/// The order of names in listings, by ICU's root collation with numbers by value.
///
/// A sort key is the collation key, a zero byte (which the key itself never holds), and the name's
/// bytes: comparing keys as bytes orders by collation first and by bytes second, and equal keys
/// mean equal names. Bytes that are not UTF-8 sort as U+FFFD.
///
/// Thread-safety: every function may be called on any thread.
[[nodiscard]] std::string nameSortKey(std::string_view name);
void appendNameSortKey(std::string& out, std::string_view name);

/// The leading part of a sort key, up to and with its zero byte: equal for names that the collation
/// does not tell apart, among them all normalisation twins.
[[nodiscard]] std::string_view sortKeyCollationPart(std::string_view key);

/// Names the rules that keys were made with; keys of another version are not comparable.
[[nodiscard]] const std::string& nameCollationVersion();

/// Whether two names are the same text under Unicode normalisation. Names that are not UTF-8 are
/// only the same when their bytes are.
[[nodiscard]] bool areNormalizationTwins(std::string_view left, std::string_view right);

}  // namespace yomber
