#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/rozzel/record.h"

namespace yomber {

/// What one person, or everybody who has the link, may do with a shared item. The numbers are those
/// that clients are given.
enum class RZShareParticipantPermission : std::int64_t {
  None = 1,
  ReadOnly = 2,
  ReadWrite = 3,
};

enum class RZShareParticipantRole : std::int64_t {
  Owner = 1,
  PrivateUser = 3,  ///< was added by name
  PublicUser = 4,   ///< came by the link, with the public permission
};

enum class RZShareParticipantAcceptanceStatus : std::int64_t {
  Pending = 1,
  Accepted = 2,
  Removed = 3,
};

/// A person in a share, by the name of the account.
///
/// Value type.
struct RZShareParticipant {
  std::string userName;
  RZShareParticipantRole role = RZShareParticipantRole::PrivateUser;
  RZShareParticipantPermission permission = RZShareParticipantPermission::ReadOnly;
  RZShareParticipantAcceptanceStatus acceptanceStatus = RZShareParticipantAcceptanceStatus::Pending;

  friend auto operator<=>(const RZShareParticipant&, const RZShareParticipant&) = default;
  [[nodiscard]] std::string description() const;
};

/// The type of records that are shares, and the name that such a record has in its zone: a zone
/// holds one share at most, and is shared as a whole.
inline constexpr const char* RZShareRecordType = "rozzel.share";
inline constexpr const char* RZShareRecordName = "share";
/// Zones made for a share have names that begin with this.
inline constexpr const char* RZShareZonePrefix = "share-";
/// Keys of a share.
inline constexpr const char* RZShareTypeKey = "rozzel.type";    ///< a text, one of the two below
inline constexpr const char* RZShareTitleKey = "rozzel.title";  ///< a text: the item's name
/// Values of RZShareTypeKey.
inline constexpr const char* RZShareTypeDocument = "document";
inline constexpr const char* RZShareTypeFolder = "folder";

class RZShare;
/// A share as the store has it, or as somebody wants it saved; never changed. Copy one to change
/// it.
using RZShareRef = std::shared_ptr<const RZShare>;

/// The record that says who sees a zone, and what they may do there.
///
/// Thread-safety and ownership: as RZRecord.
class RZShare final : public RZRecord {
 public:
  /// All that a share says.
  struct Fields {
    RZRecordZoneID zoneID;
    std::string rootRecordName = {};
    std::string changeTag = {};
    std::string type = {};
    std::string title = {};
    std::string ownerName = {};
    std::vector<RZShareParticipant> participants = {};
    RZShareParticipantPermission publicPermission = RZShareParticipantPermission::None;
    std::optional<std::string> URL = {};
  };

  /// A new one, not known to the store, of the item whose record is `rootRecordID` (in the zone
  /// that is to be shared). `ownerName` is the account that shares; it is the first participant.
  RZShare(const RZRecordID& rootRecordID, const std::string& type, const std::string& title,
          const std::string& ownerName);
  /// A record of the store; nil when it is no share, or one without what a share has to have.
  [[nodiscard]] static RZShareRef fromRecord(const RZRecord& record);
  /// A share that came from elsewhere, which need not be trusted; nil when no share can be like
  /// that.
  [[nodiscard]] static RZShareRef fromFields(const Fields& fields);

  /// The record of the item that is shared.
  [[nodiscard]] RZRecordID rootRecordID() const;
  [[nodiscard]] std::string ownerName() const;
  /// RZShareTypeDocument or RZShareTypeFolder.
  [[nodiscard]] std::string type() const;
  [[nodiscard]] std::string title() const;
  void setTitle(const std::string& title);
  /// The owner first, then by the order in which they were added.
  [[nodiscard]] std::vector<RZShareParticipant> participants() const;
  void setParticipants(const std::vector<RZShareParticipant>& participants);
  /// What everybody who has the URL may do.
  [[nodiscard]] RZShareParticipantPermission publicPermission() const;
  void setPublicPermission(RZShareParticipantPermission permission);
  /// By which others accept it: "yomber-share:" and a token that cannot be guessed. Given by the
  /// store with the first save; nil until then.
  [[nodiscard]] std::optional<std::string> URL() const;
  /// For engines, whose it is to say.
  void setURL(const std::string& url);
  /// Whether the store has it.
  [[nodiscard]] bool isKnownToServer() const { return !changeTag().empty(); }

  [[nodiscard]] std::string description() const override;

 private:
  explicit RZShare(const RZRecord& record) : RZRecord(record) {}
  void setOwnerName(const std::string& ownerName);
};

}  // namespace yomber
