// Writes what well-behaved clients send, as inputs for the socket targets, and well-formed messages
// for wire_items: make_seeds DIRECTORY makes DIRECTORY/<target>/<name>.

#include <capnp/message.h>
#include <capnp/serialize.h>

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <span>
#include <string>
#include <vector>

#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/url.h"
#include "platform/ipc/error_codec.h"
#include "protocols/changes.capnp.h"
#include "protocols/content.capnp.h"
#include "protocols/control.capnp.h"
#include "protocols/daemon.capnp.h"
#include "protocols/extension.capnp.h"
#include "protocols/services.capnp.h"
#include "protocols/sharing.capnp.h"
#include "tests/fuzz/expect.h"
#include "tests/fuzz/fixed_home.h"
#include "tests/fuzz/hostile_input.h"
#include "tests/fuzz/rpc_script.h"

namespace yomber::fuzz {
namespace {

using capnp::Schema;
using protocol::Control;
using protocol::Daemon;
using protocol::Extension;

struct Call {
  const char* method;
  std::string parameters;
};

class Corpus {
 public:
  /// `mode` is added to how each script is sent.
  Corpus(const std::string& directory, const char* target, std::uint8_t mode = 0)
      : folder_(directory + "/" + target), mode_(mode) {
    std::filesystem::create_directories(folder_);
  }

  void add(const std::string& name, std::span<const std::uint8_t> bytes) const {
    std::ofstream file(folder_ + "/" + name, std::ios::binary | std::ios::trunc);
    file.write(reinterpret_cast<const char*>(bytes.data()),
               static_cast<std::streamsize>(bytes.size()));
    expect(file.good(), "a seed was written");
  }
  void add(const std::string& name, const RpcScript& script) const {
    const auto mode = static_cast<std::uint8_t>(mode_ | kPatient);
    add(name, script.input(mode));
    add(name + "-framed", script.input(static_cast<std::uint8_t>(mode | kFramed)));
  }
  /// One input for each call, and one with all of them.
  void addCalls(capnp::InterfaceSchema interface, const std::vector<Call>& calls) const {
    RpcScript all;
    const auto server = all.bootstrap();
    for (const Call& call : calls) {
      RpcScript one;
      one.call(one.bootstrap(), interface, call.method, call.parameters.c_str());
      add(call.method, one);
      all.call(server, interface, call.method, call.parameters.c_str());
    }
    add(std::string("everything-from-") + calls.front().method, all);
  }
  /// The same for a capability that `method` of the server answers with.
  void addCallsBehind(capnp::InterfaceSchema server, const char* method,
                      capnp::InterfaceSchema interface, const std::vector<Call>& calls) const {
    RpcScript all;
    const auto place = behind(all, server, method);
    for (const Call& call : calls) {
      RpcScript one;
      one.call(behind(one, server, method), interface, call.method, call.parameters.c_str());
      add(std::string(method) + "-" + call.method, one);
      all.call(place, interface, call.method, call.parameters.c_str());
    }
    all.finish(place);
    add(std::string(method) + "-everything", all);
  }

 private:
  static RpcScript::Place behind(RpcScript& script, capnp::InterfaceSchema server,
                                 const char* method) {
    auto place = script.call(script.bootstrap(), server, method);
    place.pointers = {0};
    return place;
  }

  const std::string folder_;
  const std::uint8_t mode_;
};

/// What is done with items, by identifier; the same for extension and host.
std::vector<Call> changesOf(const std::string& item, const std::string& folder) {
  const std::string identifier = "identifier = \"" + item + "\"";
  const std::string parent = "parent = \"" + folder + "\"";
  return {{"importDocument", "(path = \"/nowhere/document\", " + parent + ")"},
          {"createDirectory", "(name = \"made\", " + parent + ")"},
          {"rename", "(" + identifier + ", name = \"renamed\")"},
          {"reparent", "(" + identifier + ", " + parent + ", newName = (value = \"moved\"))"},
          {"trash", "(" + identifier + ")"},
          {"untrash", "(" + identifier + ", " + parent + ")"},
          {"delete", "(" + identifier + ")"},
          {"setLastUsedDate", "(" + identifier + ", date = (value = 5))"},
          {"setTags", "(" + identifier + ", labels = [\"red\", \"green\"])"},
          {"setFavoriteRank", "(" + identifier + ", rank = (value = 7))"},
          {"defaultApplicationContainer", "(bundleIdentifier = \"com.example.app\")"}};
}

/// What is done with content, by location; the same for extension and host.
std::vector<Call> contentCallsOf(const std::string& path) {
  const std::string given = "(path = \"" + path + "\"";
  return {{"startProviding", given + ", options = 1)"},
          {"stopProviding", given + ")"},
          {"itemChanged", given + ")"},
          {"movingItem", given + ", destination = \"" + path + " moved\")"}};
}

/// `path` is a parameter of that name.
std::vector<Call> sharingCallsAt(const std::string& path) {
  const std::string share =
      "(share = (zoneName = \"Documents\", zoneOwner = \"grace\", rootRecord = \"2001\", changeTag "
      "= "
      "\"1\", type = \"document\", title = \"item 2\", ownerName = \"grace\", participants = "
      "[(userName = \"ada\", role = 3, permission = 2, acceptanceStatus = 1)], publicPermission = "
      "1))";
  return {{"checkIfShareable", "(rawID = 3000)"},
          {"copyShare", "(" + path + ")"},
          {"newShare", "(" + path + ")"},
          {"saveShare", share},
          {"destroyShare", share},
          {"copyShareURL", "(" + path + ", documentType = \"text/plain\")"},
          {"copyShareToken", "(" + path + ")"},
          {"refreshSharingState", "(identifier = \"d:2001\")"},
          {"shareOptions", "(identifier = \"d:2001\")"},
          {"acceptShare", "(url = \"yomber-share:guessed\")"},
          {"sharesWithMe", "()"}};
}

void addDaemonSeeds(const Corpus& corpus) {
  const auto daemon = Schema::from<Daemon>();
  const std::string root = kDaemonRoot;
  corpus.addCalls(daemon,
                  {{"describe", "()"},
                   {"urlForItemIdentifier", "(identifier = \"i:3000\")"},
                   {"documentLocation", "(object = (kind = document, rawID = 2001))"},
                   {"itemAtLocation", "(path = \"" + root + "/item 1\", fakeFSEvent = true)"},
                   {"containers", "()"},
                   {"containerItem", "(containerID = \"com.kelvo.YomberDrive\", forceScan = true)"},
                   {"enumerateItemsInFolder",
                    "(folder = (object = (kind = folder, rawID = 3000)), sortOrder = date, offset "
                    "= 3, limit = 5)"},
                   {"enumerateAllFolders", "(sortOrder = name, offset = 0, limit = 1000)"},
                   {"currentNotifRank", "()"},
                   {"enumerateWorkingSetChanges", "(token = (none = void), limit = 2)"},
                   {"account", "()"},
                   {"signIn", "(name = \"grace\")"},
                   {"signOut", "()"},
                   {"observe", "()"},
                   {"registerHost", "()"},
                   {"status", "()"}});
  const std::string path = "path = \"" + root + "/item 2\"";
  corpus.addCallsBehind(
      daemon, "content", Schema::from<protocol::Content>(),
      {{"startProviding", "(" + path + ", options = 1)"},
       {"evict", "(" + path + ")"},
       {"setPinned", "(" + path + ", pinned = true)"},
       {"capabilityToMove",
        "(source = \"" + root + "/item 2\", destination = \"" + root + "/folder/item 2\")"},
       {"trash", "(" + path + ")"},
       {"putBackLocation", "(" + path + ")"},
       {"emptyTrash", "()"},
       {"physicalLocation", "(" + path + ")"},
       {"containerLocation", "(containerID = \"com.kelvo.YomberDrive\", recreateDocuments = true)"},
       {"setLastUsedDate", "(" + path + ", date = (value = 5))"},
       {"setFavoriteRank", "(" + path + ", rank = (value = 7))"},
       {"setTagNames", "(" + path + ", names = [\"red\", \"green\"])"},
       {"contentState", "(" + path + ")"},
       {"transfers", "()"}});
  corpus.addCallsBehind(daemon, "sharing", Schema::from<protocol::Sharing>(), sharingCallsAt(path));
  RpcScript watching;
  auto sender = watching.call(watching.bootstrap(), daemon, "getItemUpdateSender");
  sender.pointers = {0, 0};
  const auto interface = Schema::from<protocol::ItemSender>();
  const std::string watched = "(path = \"" + root + "\", options = 23)";
  watching.call(sender, interface, "boostPriority");
  watching.call(sender, interface, "watchItem", watched.c_str());
  watching.call(sender, interface, "invalidate");
  watching.finish(sender);
  corpus.add("watching", watching);
}

void addControlSeeds(const Corpus& corpus) {
  const auto control = Schema::from<Control>();
  const std::string root = "NSFileProviderRootContainerItemIdentifier";
  corpus.addCalls(control, {{"item", "(identifier = \"item7\")"},
                            {"locate", "(identifier = \"item7\")"},
                            {"identify", "(path = \"/root/item7\")"},
                            {"list", "(container = \"" + root + "\", sortOrder = date)"},
                            {"watch", "(container = \"" + root + "\")"},
                            {"status", "()"}});
  corpus.addCalls(control, contentCallsOf("/root/item7"));
  corpus.addCalls(control, {{"services", "(identifier = \"item7\")"},
                            {"service", "(identifier = \"item7\", name = \"test.workshop\")"}});
  corpus.addCallsBehind(control, "changes", Schema::from<protocol::Changes>(),
                        changesOf("item7", root));
  RpcScript listing;
  auto pages = listing.call(listing.bootstrap(), control, "list", "(container = \"folder\")");
  pages.pointers = {0};
  for (int page = 0; page < 3; ++page)
    listing.call(pages, Schema::from<protocol::Listing>(), "next");
  listing.finish(pages);
  corpus.add("listing", listing);
}

void addExtensionSeeds(const Corpus& corpus) {
  const auto extension = Schema::from<Extension>();
  const auto interface = Schema::from<protocol::Enumerator>();
  corpus.addCalls(extension, {{"urlForItem", "(identifier = \"d:2001\")"},
                              {"identifierForPath", "(path = \"/tmp/item\")"},
                              {"itemForIdentifier", "(identifier = \"i:3000\")"},
                              {"enumerator", "(container = \"i:3000\")"}});
  corpus.addCalls(extension, contentCallsOf("/tmp/item"));
  corpus.addCalls(
      extension,
      {{"services", "(identifier = \"d:2001\", client = 0)"},
       {"service",
        "(identifier = \"d:2001\", name = \"com.kelvo.PandrelCollaboration\", client = 0)"}});
  corpus.addCallsBehind(extension, "changes", Schema::from<protocol::Changes>(),
                        changesOf("d:2001", "i:3000"));
  for (const char* const container : {"i:3000", "NSFileProviderRootContainerItemIdentifier",
                                      "NSFileProviderWorkingSetContainerItemIdentifier"}) {
    RpcScript listing;
    const std::string parameters = std::string("(container = \"") + container + "\")";
    auto enumerator =
        listing.call(listing.bootstrap(), extension, "enumerator", parameters.c_str());
    enumerator.pointers = {0, 0};
    listing.call(enumerator, interface, "currentSyncAnchor");
    listing.call(enumerator, interface, "enumerateItems", "(page = (initialByName = void))");
    listing.call(enumerator, interface, "enumerateItems",
                 "(page = (token = \"\\xc8\\0\\0\\0\\0\\0\\0\\0\\0\\0\\0\\0\\0\\0\\0\\0\"))");
    listing.call(enumerator, interface, "enumerateChanges",
                 "(anchor = \"123456789012345678901234\")");
    listing.call(enumerator, interface, "invalidate");
    listing.finish(enumerator);
    corpus.add(std::string("listing-") + container, listing);
  }
}

void addServiceSeeds(const Corpus& sharing, const Corpus& collaboration) {
  const std::string share =
      "(call = 1, share = (share = (zoneName = \"share-1\", zoneOwner = \"ada\", rootRecord = "
      "\"2001\", changeTag = \"1\", type = \"document\", title = \"a document\", ownerName = "
      "\"ada\", participants = [(userName = \"ada\", role = 1, permission = 3, acceptanceStatus = "
      "2), (userName = \"bob\", role = 3, permission = 2, acceptanceStatus = 1)], "
      "publicPermission = 2, url = (value = \"yomber-share:abc\"))))";
  sharing.addCalls(Schema::from<protocol::SharingService>(),
                   {{"fetchSharingInfo", "()"},
                    {"preflight", "(call = 1)"},
                    {"participants", "(call = 2)"},
                    {"startPreparing", "(forcing = true)"},
                    {"fetchShare", "(call = 3)"},
                    {"fetchShareUrl", "(call = 4)"},
                    {"saveShare", share},
                    {"unshare", "(call = 5)"}});
  collaboration.addCalls(Schema::from<protocol::CollaborationService>(),
                         {{"fetchVersionAndCapabilities", "()"},
                          {"setEnvironmentType", "(type = 1)"},
                          {"fetchCollaborationToken", "(call = 1)"},
                          {"fetchLatestRevision", "(call = 2)"},
                          {"refreshSharingState", "(call = 3)"},
                          {"fetchPrivacyState", "(call = 4)"},
                          {"documentIsInUse", "(timeout = 2.5)"},
                          {"fetchFileProviderIdentifier", "()"},
                          {"fetchUrlForSharingFile", "()"},
                          {"fetchFolderSharingState", "(call = 5)"},
                          {"fetchSharedFolderInfo", "(call = 6)"}});
  const auto peer = Schema::from<protocol::ServicePeer>();
  sharing.addCalls(peer, {{"progressed", "(call = 1, totalUnits = 2, completedUnits = 1)"},
                          {"cancel", "(call = 1)"},
                          {"goodbye", "()"}});
  RpcScript cancelling;
  const auto server = cancelling.bootstrap();
  cancelling.call(server, Schema::from<protocol::SharingService>(), "fetchShare", "(call = 1)");
  cancelling.call(server, peer, "cancel", "(call = 1)");
  cancelling.call(server, Schema::from<protocol::SharingService>(), "unshare", "(call = 2)");
  cancelling.call(server, peer, "cancel", "(call = 2)");
  cancelling.call(server, peer, "goodbye");
  sharing.add("cancelling", cancelling);
}

template <typename Root, typename Fill>
void addMessage(const Corpus& corpus, const char* name, Fill fill) {
  capnp::MallocMessageBuilder message;
  fill(message.initRoot<Root>());
  const auto words = capnp::messageToFlatArray(message);
  const auto bytes = words.asBytes();
  corpus.add(name, {bytes.begin(), bytes.size()});
}

ItemFields fullItem() {
  ItemFields item;
  item.identifier = "d:2001";
  item.parentIdentifier = "i:3000";
  item.filename = "a name.txt";
  item.contentType = "text/plain";
  item.tags = {"red", "green"};
  item.favoriteRank = 5;
  item.containerID = "com.example.app";
  return item;
}

void addMessageSeeds(const Corpus& corpus) {
  registerItemsInErrors();
  addMessage<protocol::Item>(corpus, "item", [](auto builder) { encodeItem(fullItem(), builder); });
  NSErrorRef error = NSError::errorWithDomain("Innermost", 1);
  for (int depth = 0; depth < ipc::kMaximumErrorDepth; ++depth) {
    error =
        NSError::errorWithDomain("Domain", depth,
                                 {{NSUnderlyingErrorKey, error},
                                  {"text", std::string("words")},
                                  {"number", std::int64_t{7}},
                                  {"url", NSURL::fileURLWithPath("/tmp/x")},
                                  {"item", NSObjectRef(std::make_shared<WireItem>(fullItem()))}});
  }
  addMessage<protocol::Error>(corpus, "error",
                              [&](auto builder) { ipc::encodeError(error, builder); });
  addMessage<protocol::Daemon::PageResult>(corpus, "page", [](auto builder) {
    auto items = builder.initPage().initItems(3);
    for (auto item : items) encodeItem(fullItem(), item);
  });
}

}  // namespace
}  // namespace yomber::fuzz

int main(int argc, char** argv) {
  using namespace yomber::fuzz;
  if (argc != 2) {
    (void)std::fprintf(stderr, "usage: make_seeds DIRECTORY\n");
    return 64;
  }
  const std::string directory = argv[1];
  addDaemonSeeds(Corpus(directory, "daemon_socket"));
  addControlSeeds(Corpus(directory, "control_socket"));
  addExtensionSeeds(Corpus(directory, "extension_socket"));
  addServiceSeeds(Corpus(directory, "service_socket"),
                  Corpus(directory, "service_socket", kSecondServer));
  addMessageSeeds(Corpus(directory, "wire_items"));
  return 0;
}
