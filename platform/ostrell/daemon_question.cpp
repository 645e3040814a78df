#include "platform/ostrell/daemon_question.h"

#include <charconv>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <utility>

#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kDefaultLimit{30'000};

}  // namespace

milliseconds daemonTimeLimit() {
  const char* const text = std::getenv("YOMBER_DAEMON_TIMEOUT_MS");
  if (text == nullptr) return kDefaultLimit;
  const std::string_view digits(text);
  std::int64_t value = 0;
  const auto [end, failure] = std::from_chars(digits.data(), digits.data() + digits.size(), value);
  const bool isUsable = failure == std::errc() && end == digits.data() + digits.size() &&
                        value > 0 && value <= milliseconds(std::chrono::hours(24)).count();
  if (isUsable) return milliseconds(value);
  log_error(
      qsc_default_log(),
      "[ERROR] YOMBER_DAEMON_TIMEOUT_MS is \"%s\": give it a number of milliseconds; using %lld",
      digits, static_cast<long long>(kDefaultLimit.count()));
  return kDefaultLimit;
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
