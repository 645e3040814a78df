#include "yomber/command.h"

#include <iostream>

#include <nlohmann/json.hpp>

#include "yomber/failure_text.h"
#include "yomber/item_output.h"

namespace yomber {

DrivePaths CommandContext::paths() const {
  return home.empty() ? DrivePaths::forDefaultHome() : DrivePaths::forHome(home);
}

void CommandContext::print(const nlohmann::ordered_json& answer, const std::string& text) const {
  if (json) {
    std::cout << answer.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  } else {
    std::cout << text;
  }
  std::cout << std::endl;
}

void CommandContext::fail(const NSErrorRef& error) {
  exitCode = exitCodeFor(error);
  if (json) {
    std::cerr << nlohmann::ordered_json{{"error", errorJson(error)}}.dump() << std::endl;
    return;
  }
  std::cerr << "yomber: " << failureText(error);
  if (exitCode == ExitCode::NotSignedIn)
    std::cerr << " (sign in with 'yomber account sign-in NAME')";
  std::cerr << std::endl;
}

void CommandContext::fail(ExitCode code, const std::string& message) {
  exitCode = code;
  if (json) {
    std::cerr << nlohmann::ordered_json{{"error", {{"message", message}}}}.dump() << std::endl;
  } else {
    std::cerr << "yomber: " << message << std::endl;
  }
}

}  // namespace yomber
