#include "yomber/clash_policy.h"

#include <utility>

#include "platform/foundation/bounced_name.h"
#include "yomber/failure_text.h"

namespace yomber {

namespace {

/// The clash, with what can be done about it.
NSErrorRef withAdvice(const NSErrorRef& error) {
  auto info = error->userInfo();
  info[NSLocalizedDescriptionKey] =
      failureText(error) +
      "; use --keep-both for another name, or --replace to move what is there to the trash";
  return NSError::errorWithDomain(error->domain(), error->code(), std::move(info));
}

ChangeResult replaceWith(const DriveChanges& changes, const ItemFields& inTheWay,
                         const std::function<ChangeResult()>& attempt) {
  ChangeResult trashed = changes.trash(inTheWay.identifier);
  if (trashed.error) return trashed;
  ChangeResult result = attempt();
  if (result.error) (void)changes.untrash(inTheWay.identifier, inTheWay.parentIdentifier);
  return result;
}

}  // namespace

void addClashOptions(CLI::App& command, ClashPolicy& policy) {
  auto* const keep =
      command.add_flag("--keep-both", policy.keepBoth, "Take a free name when the name is taken");
  command
      .add_flag("--replace", policy.replace,
                "Move what is in the way to the trash when the name is taken")
      ->excludes(keep);
}

ChangeResult changeWithPolicy(const DriveChanges& changes, const ClashPolicy& policy,
                              const std::string& name,
                              const std::function<ChangeResult(const std::string& name)>& attempt) {
  ChangeResult result;
  const auto isTaken = [&](const std::string& candidate) {
    result = attempt(candidate);
    return policy.keepBoth && clashIn(result.error).isClash;
  };
  (void)bouncedName(name, isTaken);
  const Clash clash = clashIn(result.error);
  if (!clash.isClash) return result;
  if (policy.replace && clash.item) {
    return replaceWith(changes, *clash.item, [&] { return attempt(name); });
  }
  result.error = withAdvice(result.error);
  return result;
}

}  // namespace yomber
