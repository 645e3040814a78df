#include "platform/foundation/ending_signals.h"

#include <initializer_list>

namespace yomber {

sigset_t blockEndingSignals() {
  sigset_t set;
  sigemptyset(&set);
  for (const int signal : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&set, signal);
  (void)pthread_sigmask(SIG_BLOCK, &set, nullptr);
  (void)std::signal(SIGPIPE, SIG_IGN);
  return set;
}

}  // namespace yomber
