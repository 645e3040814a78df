// Whatever bytes a name, a path or a `.desktop` file may have.

#include <cstddef>
#include <cstdint>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include <unicode/utf8.h>
#include <nlohmann/json.hpp>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/url.h"
#include "platform/launchservices/desktop_entry.h"
#include "tests/fuzz/expect.h"
#include "yomber/item_output.h"
#include "zarn/name_collation.h"
#include "zarn/tree_layout.h"

namespace yomber::fuzz {
namespace {

void readDesktopEntry(std::string_view text) {
  std::vector<std::string> invalid;
  const auto entry = parseDesktopEntry(text, &invalid);
  if (!entry) return;
  std::set<std::string> ids;
  for (const auto& id : entry->containerIDs) {
    expect(isValidContainerID(id), "only valid container ids are taken");
    expect(id.find('/') == std::string::npos && id != "." && id != "..",
           "an id is a folder's name");
    expect(ids.insert(id).second, "a container id is taken once");
  }
  for (const auto& id : invalid) expect(!id.empty(), "what is reported is there");
}

/// Names of at most the disk's length; the fuzzer's bytes in two parts.
void compareNames(std::string_view left, std::string_view right) {
  const std::string leftKey = nameSortKey(left);
  const std::string rightKey = nameSortKey(right);
  expect((leftKey == rightKey) == (left == right), "equal keys are equal names");
  expect(leftKey.ends_with(left), "a key ends with its name");
  const bool areTwins = areNormalizationTwins(left, right);
  expect(areTwins == areNormalizationTwins(right, left), "twins are twins both ways");
  if (areTwins) {
    expect(sortKeyCollationPart(leftKey) == sortKeyCollationPart(rightKey), "twins collate alike");
  }
}

bool isUtf8(std::string_view text) {
  for (std::int32_t index = 0; index < static_cast<std::int32_t>(text.size());) {
    UChar32 point = 0;
    U8_NEXT(text.data(), index, static_cast<std::int32_t>(text.size()), point);
    if (point < 0) return false;
  }
  return true;
}

void bounce(std::string_view name) {
  if (name.size() > kMaximumNameLength) return;
  std::set<std::string> taken;
  for (int i = 0; i < 12; ++i) {
    const auto isTaken = [&](const std::string& candidate) { return taken.contains(candidate); };
    const std::string free = bouncedName(name, isTaken);
    expect(free.size() <= kMaximumNameLength, "a bounced name fits the disk");
    expect(!isUtf8(name) || isUtf8(free), "no character is cut in two");
    expect(taken.insert(free).second, "a bounced name is free");
  }
}

void readPath(std::string_view path) {
  const auto url = NSURL::fileURLWithPath(path);
  if (url == nullptr) return;
  expect(url->path().front() == '/', "paths are absolute");
  expect(url->path() == "/" || url->path().back() != '/', "no slash at the end");
  expect(url->path().find("//") == std::string::npos, "no empty component");
  const auto again = NSURL::fileURLWithPath(url->path());
  expect(again != nullptr && again->path() == url->path(), "a normalised path stays as it is");
  (void)url->absoluteString();
  (void)url->URLByDeletingLastPathComponent();
  static const TreeLayout layout("/home/ada/drive");
  for (const std::string& location : {url->path(), layout.tree() + url->path()}) {
    if (const auto place = layout.placeOf(location)) {
      const bool isInside = location == place->path || isPathBelow(location, place->path);
      expect(isInside && isPathBelow(place->path, layout.tree()), "a place is inside the tree");
    }
    (void)layout.isPrivate(location);
    (void)layout.isExcluded(location);
  }
}

void printItem(std::string_view name, std::string_view other) {
  ItemFields item;
  item.filename = name;
  item.identifier = other;
  item.contentType = other;
  item.tags = {std::string(name), std::string(other)};
  const std::string shown = printableName(item.filename);
  expect(isUtf8(shown), "a printable name is UTF-8");
  for (const char c : shown) {
    expect(static_cast<unsigned char>(c) >= 0x20 && c != 0x7f, "no control character is printed");
  }
  (void)itemLine(item, OutputForm::Long);
  const std::string json = itemLine(item, OutputForm::Json);
  expect(nlohmann::json::accept(json), "JSON is JSON");
  expect(json.find('\n') == std::string::npos, "an item is one line");
}

}  // namespace
}  // namespace yomber::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace yomber;
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  const auto left = bytes.substr(0, size / 2);
  const auto right = bytes.substr(size / 2);
  fuzz::readDesktopEntry(bytes);
  fuzz::compareNames(left, right);
  fuzz::compareNames(bytes, bytes);
  fuzz::bounce(bytes);
  fuzz::readPath(bytes);
  fuzz::printItem(left, right);
  return 0;
}
