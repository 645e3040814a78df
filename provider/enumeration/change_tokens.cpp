#include "provider/enumeration/change_tokens.h"

namespace yomber {
namespace {

struct ChangeRecord {
  std::uint64_t rank = 0;
  UUID uuid{};
};
static_assert(sizeof(ChangeRecord) == 24);

}  // namespace

NSDataRef qs_changeTokenFromRank(std::uint64_t rank, const UUID& uuid) {
  ChangeRecord record;
  uuid_copy(record.uuid, uuid);
  record.rank = rank;
  return NSData::dataWithBytes(&record, sizeof(record));
}

std::uint64_t qs_changeTokenRankWithUUID(const NSDataRef& token, const UUID& uuid) {
  if (token == nullptr) return 0;
  ChangeRecord record;
  token->getBytes(&record, sizeof(record));
  return uuid_compare(record.uuid, uuid) == 0 ? record.rank : kChangeTokenOfAnotherGeneration;
}

}  // namespace yomber
