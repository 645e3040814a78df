#include "platform/ostrell/daemon_question.h"

#include <utility>

#include "platform/foundation/duration_setting.h"

namespace yomber {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kDefaultLimit{30'000};

}  // namespace

milliseconds daemonTimeLimit() {
  return durationSetting("YOMBER_DAEMON_TIMEOUT_MS", kDefaultLimit, milliseconds(1));
}

ipc::Patience::Question questionForDaemon(ipc::Remote<protocol::Daemon> daemon) {
  return
      [daemon = std::move(daemon)](const ipc::CallOptions& options, ipc::Patience::Answer answer) {
        using Results = protocol::Daemon::DescribeResults;
        (void)ipc::call(
            daemon, &protocol::Daemon::Client::describeRequest, [](auto) {},
            [answer = std::move(answer)](const NSErrorRef& error, const Results::Reader*) {
              answer(error);
            },
            options);
      };
}

}  // namespace yomber
