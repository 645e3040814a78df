#include "yomber/drive_status.h"

#include <algorithm>
#include <array>
#include <span>
#include <sstream>
#include <utility>

#include <nlohmann/json.hpp>

#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "yomber/drive_client.h"
#include "yomber/drive_mount.h"
#include "yomber/failure_text.h"
#include "yomber/item_output.h"
#include "yomber/transfer_view.h"

namespace yomber {
namespace {

/// Of hundreds that are under way, a person sees the first.
constexpr std::size_t kShownTransfers = 10;

std::optional<DriveStatus::Daemon> askDaemon(const ipc::Remote<protocol::Daemon>& remote) {
  DriveStatus::Daemon daemon;
  NSErrorRef error = ipc::callAndWait(
      remote, &protocol::Daemon::Client::statusRequest, [](auto) {},
      [&](auto results) {
        const auto status = results.getStatus();
        daemon.items = status.getItems();
        daemon.folders = status.getFolders();
        daemon.rank = status.getRank();
        daemon.scanning = status.getScan() == protocol::Daemon::Status::Scan::RUNNING;
        daemon.live = status.getObservation() == protocol::Daemon::Status::Observation::LIVE;
        daemon.advice = status.getObservationAdvice().cStr();
        daemon.watchedFolders = status.getWatchedFolders();
        daemon.watchers = status.getWatchers();
        daemon.residentBytes = status.getResidentBytes();
        daemon.openDescriptors = status.getOpenDescriptors();
      });
  if (error) return std::nullopt;
  error = ipc::callAndWait(
      remote, &protocol::Daemon::Client::describeRequest, [](auto) {},
      [&](auto results) { daemon.pid = results.getPid(); });
  if (error) return std::nullopt;
  return daemon;
}

std::optional<std::string> askAccount(const ipc::Remote<protocol::Daemon>& remote) {
  std::optional<std::string> name;
  const NSErrorRef error = ipc::callAndWait(
      remote, &protocol::Daemon::Client::accountRequest, [](auto) {},
      [&](auto results) {
        if (results.getResult().isAccount())
          name = results.getResult().getAccount().getName().cStr();
      });
  return error ? std::nullopt : name;
}

std::optional<DriveStatus::Host> askHost(const ipc::Remote<protocol::Control>& remote) {
  DriveStatus::Host host;
  const NSErrorRef error = ipc::callAndWait(
      remote, &protocol::Control::Client::statusRequest, [](auto) {},
      [&](auto results) {
        const auto status = results.getStatus();
        host.extensionPid = status.getExtensionPid();
        host.extensionStarts = status.getExtensionStarts();
        host.watches = status.getWatches();
        host.enumerators = status.getEnumerators();
        host.residentBytes = status.getResidentBytes();
        host.openDescriptors = status.getOpenDescriptors();
        host.lastFailure = ipc::decodeOptional(status.getLastFailure());
      });
  if (error) return std::nullopt;
  return host;
}

void describeDaemon(std::ostream& out, const DriveStatus::Daemon& daemon) {
  out << "zarn           running, pid " << daemon.pid << ", " << readableSize(daemon.residentBytes)
      << "\n"
      << "items          " << daemon.items << " in " << daemon.folders << " folders"
      << (daemon.scanning ? ", scanning" : "") << "\n"
      << "changes        " << (daemon.live ? "seen as they come" : "found by scanning") << ", "
      << daemon.watchedFolders << " folders observed\n";
  if (!daemon.advice.empty()) out << "               " << daemon.advice << "\n";
}

void describeHost(std::ostream& out, const DriveStatus::Host& host) {
  out << "fileproviderd  running, " << readableSize(host.residentBytes) << ", " << host.watches
      << " watches\n";
  if (host.extensionPid != 0) {
    out << "extension      running, pid " << host.extensionPid;
    if (host.extensionStarts > 1) out << ", started " << host.extensionStarts << " times";
    out << "\n";
  } else {
    out << "extension      not running";
    if (host.lastFailure) out << ": " << printableName(failureText(host.lastFailure));
    out << "\n";
  }
}

}  // namespace

DriveStatus readDriveStatus(const DrivePaths& paths, std::optional<pid_t> supervisor) {
  DriveStatus status;
  status.home = paths.home;
  status.supervisor = supervisor;
  status.mountPoint = mountPointOf(paths);
  DriveClient client(paths);
  if (const auto daemon = client.daemon(nullptr)) {
    status.daemon = askDaemon(daemon);
    status.account = askAccount(daemon);
    Transfers transfers;
    if (!DriveContent::transfers(daemon, transfers)) status.transfers = std::move(transfers);
  }
  if (const auto control = client.control(nullptr)) status.host = askHost(control);
  return status;
}

std::string statusText(const DriveStatus& status) {
  std::ostringstream out;
  out << "drive          " << status.home << "\n";
  if (status.mountPoint) out << "shown in       " << *status.mountPoint << "\n";
  out << "account        " << status.account.value_or("nobody is signed in") << "\n";
  if (status.daemon) {
    describeDaemon(out, *status.daemon);
  } else {
    out << "zarn           does not answer\n";
  }
  if (status.host) {
    describeHost(out, *status.host);
  } else {
    out << "fileproviderd  does not answer\n";
  }
  if (status.transfers) {
    const auto& underWay = status.transfers->underWay;
    const std::size_t shown = std::min(underWay.size(), kShownTransfers);
    for (const Transfer& transfer : std::span(underWay).first(shown)) {
      out << transferLine(transfer, 0) << "\n";
    }
    out << "transfers      " << transferSummary(*status.transfers) << "\n";
  }
  if (!status.supervisor) out << "Start the drive with 'yomber up'.\n";
  return out.str();
}

namespace {

nlohmann::ordered_json transferJson(const Transfer& transfer) {
  constexpr std::array<const char*, 3> kinds{"upload", "download", "evict"};
  nlohmann::ordered_json json{{"kind", kinds.at(static_cast<std::size_t>(transfer.kind))},
                              {"location", transfer.path},
                              {"done", transfer.done},
                              {"total", transfer.total},
                              {"attempts", transfer.attempts}};
  if (transfer.failure) json["failure"] = errorJson(transfer.failure);
  if (transfer.nextAttempt) json["next_attempt"] = transfer.nextAttempt->description();
  return json;
}

nlohmann::ordered_json transfersJson(const Transfers& transfers) {
  auto underWay = nlohmann::ordered_json::array();
  for (const Transfer& transfer : transfers.underWay) underWay.push_back(transferJson(transfer));
  return {{"under_way", std::move(underWay)},
          {"waiting", transfers.waiting},
          {"finished", transfers.finished}};
}

}  // namespace

nlohmann::ordered_json statusJson(const DriveStatus& status) {
  nlohmann::ordered_json json{{"home", status.home}, {"up", status.daemon && status.host}};
  if (status.supervisor) json["supervisor"] = {{"pid", *status.supervisor}};
  if (status.mountPoint) json["mount"] = *status.mountPoint;
  if (status.account) json["account"] = *status.account;
  if (status.daemon) {
    json["zarn"] = {{"pid", status.daemon->pid},
                    {"items", status.daemon->items},
                    {"folders", status.daemon->folders},
                    {"rank", status.daemon->rank},
                    {"scanning", status.daemon->scanning},
                    {"live", status.daemon->live},
                    {"advice", status.daemon->advice},
                    {"watched_folders", status.daemon->watchedFolders},
                    {"watchers", status.daemon->watchers},
                    {"resident_bytes", status.daemon->residentBytes},
                    {"open_descriptors", status.daemon->openDescriptors}};
  }
  if (status.host) {
    json["fileproviderd"] = {{"watches", status.host->watches},
                             {"enumerators", status.host->enumerators},
                             {"resident_bytes", status.host->residentBytes},
                             {"open_descriptors", status.host->openDescriptors}};
    json["extension"] = {{"pid", status.host->extensionPid},
                         {"starts", status.host->extensionStarts}};
    if (status.host->lastFailure)
      json["extension"]["failure"] = errorJson(status.host->lastFailure);
  }
  if (status.transfers) json["transfers"] = transfersJson(*status.transfers);
  return json;
}

}  // namespace yomber
