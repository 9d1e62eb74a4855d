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
using Ids = std::vector<std::string>;

// Answers at once, or keeps the reply for the test to give (or never give).
class ScriptedAssistantRegistry final : public AssistantAppRegistry {
 public:
  void queryEntitledApplications(Reply reply) override {
    std::lock_guard l(m);
    ++queries;
    if (immediately) {
      reply(answer);
    } else {
      pending = std::move(reply);
    }
  }
  bool immediately = true;
  std::vector<std::optional<std::string>> answer;
  std::mutex m;
  int queries = 0;
  Reply pending;
};

Ids sorted(Ids v) {
  std::sort(v.begin(), v.end());
  return v;
}

class AssistantQueries : public ::testing::Test {
 protected:
  AssistantQueries() {
    registry->apps = {installed("org.vireon.Notes"), installed("org.vireon.Music"), installed("org.example.Mail")};
    defaults = env.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::AssistantDomain));
  }
  VexaAppQuerier querier(std::chrono::milliseconds wait = VexaAppQuerier::kDefaultWait) {
    return VexaAppQuerier(defaults, extensions, registry, wait);
  }
  void enableAssistant(bool on) { defaults->setObject(FBFStrings::LinuxDefaults::AssistantEnabled, on); }

  TestEnvironment env;
  std::shared_ptr<UserDefaults> defaults;
  std::shared_ptr<FixedRegistry> registry = std::make_shared<FixedRegistry>();
  std::shared_ptr<ScriptedAssistantRegistry> extensions = std::make_shared<ScriptedAssistantRegistry>();
};

// Guards against: the asker not waiting for a reply from another thread, waiting forever, or a late reply crashing.
TEST_F(AssistantQueries, WaitsForTheReplyUntilTheConfiguredBound) {
  LogCapture logs;
  enableAssistant(true);
  extensions->immediately = false;
  std::thread answerer([this] {
    for (;; std::this_thread::yield()) {
      std::lock_guard l(extensions->m);
      if (extensions->pending) return extensions->pending({std::string("org.example.Todo")});
    }
  });
  EXPECT_EQ(sorted(querier().findEnabledVexaApps({}, {})),
            (Ids{"org.example.Todo", "org.vireon.Music", "org.vireon.Notes"}));
  answerer.join();

  extensions->pending = nullptr;
  EXPECT_TRUE(querier(20ms).findEnabledVexaApps({"seed"}, {}).empty());
  EXPECT_TRUE(logs.contains("query of assistant-entitled applications timed out"));
  ASSERT_TRUE(extensions->pending);
  std::thread late([reply = std::move(extensions->pending)] { reply({std::string("org.example.Late")}); });
  late.join();
}

}  // namespace
}  // namespace fbf::testing
