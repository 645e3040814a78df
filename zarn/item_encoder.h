#pragma once

#include <cstdint>
#include <string>

#include "protocols/common.capnp.h"
#include "zarn/item_row.h"
#include "zarn/listing.h"

namespace yomber {

// Rows on the wire, straight from the engine's form: listings are made of millions of them.

/// Writes every field. `builder` must be fresh.
void encodeRow(const ItemRow& row, protocol::Item::Builder builder);
/// The same with the content type that `itemContentType` answers.
void encodeRow(const ItemRow& row, const std::string& contentType, protocol::Item::Builder builder);
/// Writes a deletion: identifier, kind, raw id and the dead flag.
void encodeDeadItem(std::uint64_t id, ItemKind kind, protocol::Item::Builder builder);

/// How many words a row takes at most in a message, its place in a list included, so that a page is
/// built in one piece.
[[nodiscard]] std::uint64_t encodedRowWords(const ItemRow& row);
[[nodiscard]] std::uint64_t encodedPageWords(const ListingPage& page);

}  // namespace yomber
