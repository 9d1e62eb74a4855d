#include "whitelist/vexa_app_querier.h"

#include "assembly/fbf_strings.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>

namespace fbf {
namespace {

using namespace std::chrono_literals;

class FixedRegistry final : public ApplicationRegistry {
 public:
  std::vector<InstalledApplication> installedApplications() const override { return apps; }
  std::vector<InstalledApplication> apps;
};

// Answers at once, later by hand, or never.
class ScriptedAssistantRegistry final : public AssistantAppRegistry {
 public:
  enum class Mode { immediately, byHand, never };

  void queryEntitledApplications(Reply reply) override {
    std::lock_guard l(m);
    ++queries;
    if (mode == Mode::immediately) {
      reply(answer);
    } else {
      pending = std::move(reply);
    }
  }

  Mode mode = Mode::immediately;
  std::vector<std::optional<std::string>> answer;
  std::mutex m;
  int queries = 0;
  Reply pending;
};

std::vector<std::string> sorted(std::vector<std::string> v) {
  std::sort(v.begin(), v.end());
  return v;
}

class AssistantQueries : public ::testing::Test {
 protected:
  AssistantQueries() {
    registry->apps = {{"org.vireon.Notes", std::string("1"), false},
                      {"org.vireon.Music", std::string("1"), false},
                      {"org.example.Mail", std::string("1"), false}};
    defaults =
        env.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::AssistantDomain));
  }

  VexaAppQuerier querier(std::chrono::milliseconds wait = VexaAppQuerier::kDefaultWait) {
    return VexaAppQuerier(defaults, extensions, registry, wait);
  }
  void enableAssistant(bool on) {
    defaults->setObject(FBFStrings::LinuxDefaults::AssistantEnabled, on);
  }

  testing::TestEnvironment env;
  std::shared_ptr<UserDefaults> defaults;
  std::shared_ptr<FixedRegistry> registry = std::make_shared<FixedRegistry>();
  std::shared_ptr<ScriptedAssistantRegistry> extensions =
      std::make_shared<ScriptedAssistantRegistry>();
};

TEST_F(AssistantQueries, AssistantOffOrUnsetAsksNothing) {
  EXPECT_TRUE(querier().findEnabledVexaApps({"seed"}, {}).empty());
  EXPECT_EQ(querier().assistantEnabled(), false);
  enableAssistant(false);
  EXPECT_TRUE(querier().findEnabledVexaApps({"seed"}, {}).empty());
  EXPECT_EQ(extensions->queries, 0);
}

TEST_F(AssistantQueries, WithoutAssistantPreferencesNothingIsAsked) {
  VexaAppQuerier noDefaults(nullptr, extensions, registry);
  EXPECT_EQ(noDefaults.assistantEnabled(), std::nullopt);
  EXPECT_TRUE(noDefaults.findEnabledVexaApps({"seed"}, {}).empty());
  EXPECT_EQ(extensions->queries, 0);
}

TEST_F(AssistantQueries, UnitesSeedEntitledAndFirstPartyApps) {
  enableAssistant(true);
  extensions->answer = {std::string("org.example.Todo"), std::nullopt, std::string("seed")};
  auto result = querier().findEnabledVexaApps({"seed"}, {});
  EXPECT_EQ(sorted(result), (std::vector<std::string>{"org.example.Todo", "org.vireon.Music",
                                                      "org.vireon.Notes", "seed"}));
}

TEST_F(AssistantQueries, AppsDisabledForSearchAreRemoved) {
  enableAssistant(true);
  extensions->answer = {std::string("org.example.Todo")};
  auto result = querier().findEnabledVexaApps({"seed"}, {"org.vireon.Music", "org.example.Todo"});
  EXPECT_EQ(sorted(result), (std::vector<std::string>{"org.vireon.Notes", "seed"}));
}

TEST_F(AssistantQueries, RegistryThatNeverAnswersGivesAnEmptyList) {
  testing::LogCapture logs;
  enableAssistant(true);
  extensions->mode = ScriptedAssistantRegistry::Mode::never;
  EXPECT_TRUE(querier(20ms).findEnabledVexaApps({"seed"}, {}).empty());
  EXPECT_TRUE(logs.contains("query of assistant-entitled applications timed out"));
}

TEST_F(AssistantQueries, LateAnswerAfterTheWaitIsHarmless) {
  enableAssistant(true);
  extensions->mode = ScriptedAssistantRegistry::Mode::byHand;
  EXPECT_TRUE(querier(10ms).findEnabledVexaApps({"seed"}, {}).empty());
  ASSERT_TRUE(extensions->pending);
  // The asker has gone; the reply still has somewhere to write.
  std::thread late(
      [reply = std::move(extensions->pending)] { reply({std::string("org.example.Late")}); });
  late.join();
}

TEST_F(AssistantQueries, AnswerFromAnotherThreadIsCollected) {
  enableAssistant(true);
  extensions->mode = ScriptedAssistantRegistry::Mode::byHand;
  std::thread answerer([this] {
    while (true) {
      {
        std::lock_guard l(extensions->m);
        if (extensions->pending) {
          extensions->pending({std::string("org.example.Todo")});
          return;
        }
      }
      std::this_thread::yield();
    }
  });
  auto result = querier().findEnabledVexaApps({}, {});
  answerer.join();
  EXPECT_EQ(sorted(result),
            (std::vector<std::string>{"org.example.Todo", "org.vireon.Music", "org.vireon.Notes"}));
}

}  // namespace
}  // namespace fbf
