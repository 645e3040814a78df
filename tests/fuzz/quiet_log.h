#pragma once

#include <memory>
#include <string_view>

#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"

namespace yomber::fuzz {

/// Lines are made of whatever the input holds, and thrown away.
class DroppingSink final : public Log::Sink {
 public:
  void write(LogLevel /*level*/, std::string_view /*line*/) override {}
};

inline void quietLogs() {
  const auto sink = std::make_shared<DroppingSink>();
  for (Log* const log : {&defaultLog(), &qsc_default_log()}) {
    log->setSink(sink);
    log->setLevel(LogLevel::Debug);
  }
}

}  // namespace yomber::fuzz
