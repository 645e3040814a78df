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
    std::cout << jsonLine(answer);
  } else {
    std::cout << text;
  }
  std::cout << std::endl;
}

void CommandContext::fail(const NSErrorRef& error) {
  exitCode = exitCodeFor(error);
  if (json) {
    std::cerr << jsonLine({{"error", errorJson(error)}}) << std::endl;
    return;
  }
  std::cerr << "yomber: " << printableName(failureText(error));
  if (exitCode == ExitCode::NotSignedIn)
    std::cerr << " (sign in with 'yomber account sign-in NAME')";
  std::cerr << std::endl;
}

void CommandContext::fail(ExitCode code, const std::string& message) {
  exitCode = code;
  if (json) {
    std::cerr << jsonLine({{"error", {{"message", message}}}}) << std::endl;
  } else {
    std::cerr << "yomber: " << printableName(message) << std::endl;
  }
}

}  // namespace yomber
