// Which installed applications the voice assistant can use.
//
// The answer unites the given identifiers, the applications the extension
// registry reports as entitled to the assistant (with an intents extension)
// and the first-party applications ("org.vireon." identifiers), minus those
// the user disabled for search. The registry answers asynchronously; the
// caller is blocked for at most the configured wait (5 s in the daemon) and a
// registry that never answers gives an empty list.
//
// Thread-safety: `findEnabledVexaApps` may be called from any thread and
// blocks it; the registry's reply may arrive on any thread, also after the
// caller gave up.
#pragma once

#include "platform/user_defaults.h"
#include "whitelist/application_registry.h"

#include <chrono>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace fbf {

class VexaAppQuerierProtocol {
 public:
  virtual ~VexaAppQuerierProtocol() = default;
  // Bundle identifiers in no particular order; empty when the assistant is
  // off, its preferences are unavailable, or the registry did not answer.
  virtual std::vector<std::string> findEnabledVexaApps(
      const std::vector<std::string>& apps, const std::set<std::string>& manuallyDisabledApps) = 0;
};

class VexaAppQuerier final : public VexaAppQuerierProtocol {
 public:
  static constexpr std::chrono::milliseconds kDefaultWait{5000};
  static constexpr std::string_view kFirstPartyPrefix = "org.vireon.";

  // `assistantDefaults` is the assistant's preferences domain (null when it
  // cannot be opened).
  VexaAppQuerier(std::shared_ptr<UserDefaults> assistantDefaults,
                 std::shared_ptr<AssistantAppRegistry> extensions,
                 std::shared_ptr<const ApplicationRegistry> applications,
                 std::chrono::milliseconds wait = kDefaultWait);

  std::vector<std::string> findEnabledVexaApps(
      const std::vector<std::string>& apps,
      const std::set<std::string>& manuallyDisabledApps) override;

  // No value without preferences; otherwise the "Assistant Enabled" flag.
  std::optional<bool> assistantEnabled() const;
  std::set<std::string> getFirstPartyApps() const;

 private:
  std::shared_ptr<UserDefaults> assistantDefaults_;
  std::shared_ptr<AssistantAppRegistry> extensions_;
  std::shared_ptr<const ApplicationRegistry> applications_;
  std::chrono::milliseconds wait_;
};

}  // namespace fbf
