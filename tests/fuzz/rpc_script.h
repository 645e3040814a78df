#pragma once

#include <capnp/message.h>
#include <capnp/schema.h>

#include <cstdint>
#include <string>
#include <vector>

namespace yomber::fuzz {

/// What a well-behaved client sends over a connection, as one input of the fuzzer: where a session
/// begins whose changed copies then reach the servers behind the protocol.
class RpcScript {
 public:
  /// A capability in an answer that need not have come: by the pointers that lead to it.
  struct Place {
    std::uint32_t question = 0;
    std::vector<std::uint16_t> pointers;
  };

  /// Asks for what the server offers.
  Place bootstrap();
  /// Calls `method` with parameters in the schema language's text form, "(offset = 3)". Parameters
  /// that are capabilities are this side's own. Answers the place of its results.
  Place call(const Place& target, capnp::InterfaceSchema interface, const char* method,
             const char* parameters = "()");
  /// The answer is done with, and so is what it holds.
  void finish(const Place& place);

  /// The input; `mode` is its first byte (hostile_input.h).
  [[nodiscard]] std::vector<std::uint8_t> input(std::uint8_t mode) const;

 private:
  void add(capnp::MallocMessageBuilder& message);

  std::uint32_t nextQuestion_ = 0;
  std::uint32_t nextExport_ = 0;
  std::vector<std::vector<std::uint8_t>> messages_;  ///< each the one segment
};

}  // namespace yomber::fuzz
