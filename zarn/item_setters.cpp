#include "zarn/item_setters.h"

#include <unicode/ustring.h>

#include <algorithm>
#include <cerrno>

#include "zarn/change_times.h"
#include "zarn/daemon_errors.h"
#include "zarn/folder_snapshot.h"
#include "zarn/item_attributes.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr int kMaximumAttempts = 4;
/// The most that the system lets an attribute hold; file systems may take less.
constexpr std::size_t kLargestAttribute = 65536;

bool isText(std::string_view bytes) {
  if (bytes.find('\0') != std::string_view::npos) return false;
  UErrorCode status = U_ZERO_ERROR;
  std::int32_t length = 0;
  u_strFromUTF8(nullptr, 0, &length, bytes.data(), static_cast<std::int32_t>(bytes.size()),
                &status);
  return status != U_INVALID_CHAR_FOUND;
}

std::string_view trimmed(std::string_view text) {
  const std::size_t begin = text.find_first_not_of(' ');
  if (begin == std::string_view::npos) return {};
  return text.substr(begin, text.find_last_not_of(' ') - begin + 1);
}

/// Names as they will be read back; an error for one that cannot be.
NSErrorRef normalizeTags(const std::vector<std::string>& names, std::vector<std::string>& out) {
  for (const std::string& given : names) {
    const std::string name(trimmed(given));
    const bool isGood = !name.empty() && name.size() <= kLargestAttribute &&
                        name.find(',') == std::string::npos && isText(name);
    if (!isGood) {
      return invalidParameterError(
          "tag name; a tag is text that is not empty and has no comma, which separates tags",
          given);
    }
    if (std::find(out.begin(), out.end(), name) == out.end()) out.push_back(name);
  }
  return nullptr;
}

std::optional<std::string> attributeText(const std::optional<std::int64_t>& number) {
  return number ? std::optional(std::to_string(*number)) : std::nullopt;
}

NSErrorRef couldNotSet(int number, std::string_view path) {
  std::string reason;
  switch (number) {
    case E2BIG:
    case ERANGE:
    case ENOSPC:
    case EDQUOT:
      reason =
          "this is more than a file on this disk can carry, or the disk is full; use fewer or "
          "shorter tags, or free some space";
      break;
    case EACCES:
    case EPERM:
      reason = "the item is read-only; allow yourself to write to it first (chmod u+w)";
      break;
    case ENOTSUP:
      reason = "this disk's file system keeps no user attributes; move the drive to one that does";
      break;
    default:
      reason = "could not be set: " + NSError::errorWithErrno(number)->localizedDescription();
  }
  return refusedError(number, path, reason);
}

/// Whether the row still is the one that was located, and the entry its file.
bool isStill(const ItemRow& row, const LocatedItem& item, const FolderEntry& entry) {
  return row.parent == item.row.parent && row.nameOnDisk() == item.row.nameOnDisk() &&
         row.inode == entry.inode;
}

/// On the writer thread, so that of two that set the same, disk and row have the same last one.
/// Answers errno; ESTALE when the item has moved on.
int applyChange(WriteTransaction& transaction, const LocatedItem& item, const char* attribute,
                const std::optional<std::string>& value,
                const std::function<void(ItemExtra&)>& apply) {
  const auto before = findByID(transaction.connection(), item.row.id);
  const int folder = item.folder->get();
  FolderEntry entry;
  if (!before || !lookAtEntry(folder, item.name.c_str(), entry)) return ESTALE;
  if (!isStill(*before, item, entry)) return ESTALE;
  ItemExtra extra = before->extra ? *before->extra : ItemExtra{};
  apply(extra);
  ItemRow after = *before;
  after.extra = extra.isEmpty() ? nullptr : std::make_shared<const ItemExtra>(std::move(extra));
  const bool wasKept = (before->flags & row_flag::kKeepsExtra) != 0;
  if (!entry.carriesID()) {
    after.flags |= row_flag::kKeepsExtra;
  } else if (!wasKept) {
    // What is kept goes to the file, which can carry it by now, with the next scan.
    const int failure = writeItemAttribute(folder, item.name, entry.inode, attribute, value);
    if (failure != 0) return failure;
    if (before->ctime == entry.ctime && !transaction.isBusy(entry.inode)) {
      after.ctime = changeTimeAfterOwnWrite(folder, item.name, after).value_or(after.ctime);
    }
  }
  const bool hasSameExtra = before->extra == after.extra ||
                            (before->extra && after.extra && *before->extra == *after.extra);
  if (hasSameExtra) {
    after.flags = before->flags | (after.flags & row_flag::kKeepsExtra);
    transaction.updateQuietly(after);
  } else {
    (void)transaction.update(*before, after);  // in its place
  }
  return 0;
}

}  // namespace

NSErrorRef ItemSetters::setLastUsedDate(std::string_view path, std::optional<std::int64_t> date) {
  return make(path, {.attribute = kLastUsedAttribute,
                     .value = attributeText(date),
                     .apply = [&](ItemExtra& extra) { extra.lastUsed = date; }});
}

NSErrorRef ItemSetters::setFavoriteRank(std::string_view path, std::optional<std::int64_t> rank) {
  return make(path, {.attribute = kFavoriteAttribute,
                     .value = attributeText(rank),
                     .apply = [&](ItemExtra& extra) { extra.favoriteRank = rank; }});
}

NSErrorRef ItemSetters::setTagNames(std::string_view path, const std::vector<std::string>& names) {
  std::vector<std::string> tags;
  if (NSErrorRef error = normalizeTags(names, tags)) return error;
  const std::string text = joinTags(tags);
  if (text.size() > kLargestAttribute) return couldNotSet(E2BIG, path);
  return make(path, {.attribute = kTagsAttribute,
                     .value = tags.empty() ? std::nullopt : std::optional(text),
                     .apply = [&](ItemExtra& extra) { extra.tags = tags; }});
}

NSErrorRef ItemSetters::make(std::string_view path, const Change& change) {
  for (int attempt = 0; attempt < kMaximumAttempts; ++attempt) {
    NSErrorRef error;
    const auto item = locateItem(*store_, *scanner_, path, &error);
    if (!item) return error;
    if (item->row.parent == kNoParent) {
      return refusedError(EPERM, path,
                          "the drive itself and its trash take no tags, dates or ranks; choose an "
                          "item");
    }
    int failure = 0;
    error = store_->database()->write([&](WriteTransaction& transaction) -> NSErrorRef {
      failure = applyChange(transaction, *item, change.attribute, change.value, change.apply);
      return failure == 0 ? nullptr : couldNotSet(failure, path);
    });
    if (failure != ESTALE) return error;
  }
  return noSuchLocationError(std::string(path));
}

}  // namespace yomber
