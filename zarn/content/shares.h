#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/share.h"
#include "zarn/content/content_core.h"
#include "zarn/content/share_rows.h"

namespace yomber {

/// What of the drive is shared with others, and what others share with it.
///
/// A share makes its item's records a zone of their own. Whoever accepts one has the item in his
/// drive; from then on what others change there is taken over, every `interval` and whenever
/// somebody asks. See docs/sharing.md.
///
/// Failures are those of the store (RZErrorDomain), NSCocoaErrorDomain 4354 when it is out of reach
/// and 4 when there is no such item, QSOstrellErrorDomain 2 while nobody is signed in, and what is
/// said below. Locations may be logical or physical. Thread-safety: every operation may be called
/// on any thread but the database's writer thread; each may take as long as the store does.
class Shares {
 public:
  struct Options {
    std::chrono::milliseconds interval{3'000};
    /// For how long an accepted item may take to appear before the answer is given all the same.
    std::chrono::milliseconds patience{20'000};
  };
  Shares(std::shared_ptr<ContentCore> core, Options options);
  ~Shares();
  Shares(const Shares&) = delete;
  Shares& operator=(const Shares&) = delete;

  void start();
  void stop();

  /// Nil, or why a folder cannot be shared: NSPOSIXErrorDomain with the reason.
  [[nodiscard]] NSErrorRef checkShareable(std::uint64_t id);
  struct Copied {
    RZShareRef share;
    std::optional<std::string> rootPath;  ///< the shared folder, when the item lies in one
  };
  /// QSOstrellErrorDomain 20 when the item is in no share.
  [[nodiscard]] NSErrorRef copyShare(std::string_view path, Copied& copied);
  [[nodiscard]] NSErrorRef newShare(std::string_view path, RZShareRef& share);
  [[nodiscard]] NSErrorRef save(const RZShare& share, RZShareRef& saved);
  [[nodiscard]] NSErrorRef destroy(const RZShare& share);
  struct Tokens {
    std::string share;
    std::string base;
  };
  [[nodiscard]] NSErrorRef copyTokens(std::string_view path, Tokens& tokens);
  /// Returns when what the store now says is taken over; fails where the item's own share cannot be
  /// followed, for the root where any cannot.
  [[nodiscard]] NSErrorRef refresh(std::string_view identifier);
  struct ItemOptions {
    bool isShared = false;
    bool mayWrite = true;
    bool isSharedItself = false;
    std::optional<std::string> folderName;
  };
  [[nodiscard]] NSErrorRef options(std::string_view identifier, ItemOptions& options);
  [[nodiscard]] NSErrorRef accept(const std::string& url, std::string& identifier);
  [[nodiscard]] NSErrorRef sharesWithMe(std::vector<RZShareRef>& shares);

 private:
  struct Item {
    ItemRow row;
    std::optional<ShareRow> share;  ///< that it is in, or is
    std::optional<ContentRow> content;
  };
  /// Who is signed in, for one request or pass.
  struct Session {
    std::shared_ptr<ContentStore> store;
    std::int64_t account = 0;
  };
  using Zones = std::vector<RZRecordZone>;

  NSErrorRef open(Session& session) const;
  // The same, and finds the item that the request is about.
  NSErrorRef openAt(std::string_view path, Session& session, Item& item) const;
  NSErrorRef openFor(std::string_view identifier, Session& session, Item& item) const;
  NSErrorRef readItem(std::uint64_t id, Item& item) const;
  NSErrorRef checkNesting(Connection& connection, const ItemRow& row) const;
  NSErrorRef checkSaved(const Session& session, const RZShare& share, const ItemRow& row) const;

  /// What failed in a pass. One share's failure keeps no other from being followed.
  struct Failures {
    NSErrorRef ofAll;  ///< that nothing could be followed, or no more
    std::map<RZRecordZoneID, NSErrorRef> ofZones;

    [[nodiscard]] NSErrorRef of(const RZRecordZoneID& zone) const;
    [[nodiscard]] NSErrorRef any() const;
  };

  void work();
  void poke();
  static void logNew(const Failures& failures, const Failures& before);
  Failures pass() REQUIRES(working_);
  NSErrorRef beginAccount(const Session& session) REQUIRES(working_);
  NSErrorRef askForWaitingAgain(std::int64_t account) const;
  NSErrorRef noteRemovalsBeforeStart(std::int64_t account) const;
  void followZones(const Session& session, Failures& failures) REQUIRES(working_);
  void adoptNew(const Session& session, const Zones& zones, const std::vector<ShareRow>& known,
                Failures& failures) REQUIRES(working_);
  void takeOverRefused(const Session& session, Failures& failures) REQUIRES(working_);
  NSErrorRef adopt(const Session& session, const RZRecordZone& zone);
  NSErrorRef adoptForeign(ShareRow row, const RZShare& share);
  /// An item that is here must be the one that is shared: marked so, of that kind, of no share.
  static bool canBecome(Connection& connection, const ShareRow& row);
  NSErrorRef checkAccepted(const Session& session, const RZShare& share, std::uint64_t root) const;
  NSErrorRef adoptOwn(ShareRow row, const RZShare& share) const;
  NSErrorRef follow(const std::shared_ptr<ContentStore>& store, ShareRow share, const Zones& zones);
  NSErrorRef beginOwn(ShareRow share) const;
  void followPermission(const ContentStore& store, ShareRow& share) const;

  const std::shared_ptr<ContentCore> core_;
  const Options options_;
  Mutex working_;  ///< held while shares are changed or followed, also while calling the store
  Mutex mutex_;
  Condition changed_;
  bool isPoked_ GUARDED_BY(mutex_) = false;
  bool isEnding_ GUARDED_BY(mutex_) = false;
  /// For which was seen to what happened before this process.
  std::set<std::int64_t> begun_ GUARDED_BY(working_);
  /// Shared items that were not there the last time: one that is on its way is not gone.
  std::set<std::uint64_t> missing_;
  /// Of accepted shares whose identifiers are other items' here, which was said once.
  std::set<RZRecordZoneID> refused_;
  std::thread thread_;
};

}  // namespace yomber
