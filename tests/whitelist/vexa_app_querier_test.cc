#include "whitelist/vexa_app_querier.h"

#include "assembly/fbf_strings.h"
#include "support/test_support.h"
#include "whitelist/whitelist_fixtures.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>
#include <thread>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

// Keeps each reply for the test to give (or never give).
class ScriptedAssistantRegistry final : public AssistantAppRegistry {
 public:
  void queryEntitledApplications(Reply reply) override {
    std::lock_guard l(m);
    pending = std::move(reply);
  }
  std::mutex m;
  Reply pending;
};

// Guards against: the asker not waiting for a reply from another thread, waiting forever, or a late reply crashing.
TEST(AssistantQueries, WaitsForTheReplyUntilTheConfiguredBound) {
  TestEnvironment env;
  LogCapture logs;
  auto registry = std::make_shared<FixedRegistry>();
  registry->apps = {installed("org.vireon.Notes"), installed("org.vireon.Music"), installed("org.example.Mail")};
  auto defaults = env.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::AssistantDomain));
  defaults->setObject(FBFStrings::LinuxDefaults::AssistantEnabled, true);
  auto extensions = std::make_shared<ScriptedAssistantRegistry>();
  std::thread answerer([&] {
    for (;; std::this_thread::yield()) {
      std::lock_guard l(extensions->m);
      if (extensions->pending) return extensions->pending({std::string("org.example.Todo")});
    }
  });
  auto found = VexaAppQuerier(defaults, extensions, registry).findEnabledVexaApps({}, {});
  answerer.join();
  std::sort(found.begin(), found.end());
  EXPECT_EQ(found, (std::vector<std::string>{"org.example.Todo", "org.vireon.Music", "org.vireon.Notes"}));

  extensions->pending = nullptr;
  EXPECT_TRUE(VexaAppQuerier(defaults, extensions, registry, 20ms).findEnabledVexaApps({"seed"}, {}).empty());
  EXPECT_TRUE(logs.contains("query of assistant-entitled applications timed out"));
  ASSERT_TRUE(extensions->pending);
  std::thread late([reply = std::move(extensions->pending)] { reply({std::string("org.example.Late")}); });
  late.join();
}

}  // namespace
}  // namespace fbf::testing
