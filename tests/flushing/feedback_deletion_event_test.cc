#include "assembly/feedback_deletion_event.h"
#include "assembly/fbf_assembly.h"
#include "flushing/flushing_test_util.h"
#include "platform/analytics.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <fstream>

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// Files that the flusher is about to drop, and the loss record of each.
class FeedbackLossRecord : public ::testing::Test {
 protected:
  std::optional<FeedbackDeletionEvent> eventFor(size_t bytes, int32_t type = 2) {
    auto file = makeFile(env.cacheDir(), "f" + std::to_string(bytes), std::string(bytes, 'b'));
    return FeedbackDeletionEvent::make(file, type, FeedbackDeletionReason::tooLarge,
                                       creationDate(*env.fileManager, file) + 5s, *env.fileManager);
  }
  TestEnvironment env;
};

TEST_F(FeedbackLossRecord, SizeIsInKibibytesRoundedUp) {
  EXPECT_EQ(eventFor(0)->size, 0u);
  EXPECT_EQ(eventFor(1)->size, 1u);
  EXPECT_EQ(eventFor(1024)->size, 1u);
  EXPECT_EQ(eventFor(1025)->size, 2u);
  EXPECT_EQ(eventFor(3 * 1024 + 1)->size, 4u);
}

TEST_F(FeedbackLossRecord, AgeIsTruncatedTowardZeroEvenWhenNegative) {
  auto file = makeFile(env.cacheDir(), "f");
  SystemTime created = creationDate(*env.fileManager, file);
  auto later = FeedbackDeletionEvent::make(file, 11, 1, created + 90s + 900ms, *env.fileManager);
  ASSERT_TRUE(later);
  EXPECT_EQ(later->age, 90);
  auto earlier = FeedbackDeletionEvent::make(file, 11, 1, created - 2s - 500ms, *env.fileManager);
  ASSERT_TRUE(earlier);
  EXPECT_EQ(earlier->age, -2);
  EXPECT_EQ(earlier->feedbackType, 11);
  EXPECT_EQ(earlier->reason, 1);
}

TEST_F(FeedbackLossRecord, UnknownTypeAndEndMarkerAreNeverReported) {
  for (int32_t reason : {1, 2, 3, 5, 12}) {
    EXPECT_FALSE(eventFor(10, 0).has_value()) << reason;
    EXPECT_FALSE(eventFor(10, 14).has_value()) << reason;
  }
  EXPECT_TRUE(eventFor(10, 1));
  EXPECT_TRUE(eventFor(10, 13));
}

TEST_F(FeedbackLossRecord, AFileThatIsAlreadyGoneGivesNoRecord) {
  EXPECT_FALSE(FeedbackDeletionEvent::make(env.cacheDir() / "missing", 2, 1, env.clock->now(),
                                           *env.fileManager));
}

TEST_F(FeedbackLossRecord, EncodesExactlyItsFourKeys) {
  FeedbackDeletionEvent e{13, 12, 7, -3};
  auto json = e.toJSON();
  ASSERT_TRUE(json.is_object());
  EXPECT_EQ(json.size(), 4u);
  EXPECT_EQ(json.at("feedbackType"), 13);
  EXPECT_EQ(json.at("reason"), 12);
  EXPECT_EQ(json.at("size"), 7);
  EXPECT_EQ(json.at("age"), -3);
}

// Holds each payload function and hands it to the real sink only when told,
// as a sink that records lazily would.
class DeferringSink final : public AnalyticsSink {
 public:
  explicit DeferringSink(std::unique_ptr<AnalyticsSink> inner) : inner_(std::move(inner)) {}
  void sendEvent(std::string_view name,
                 const std::function<std::optional<nlohmann::json>()>& payload) override {
    held_.emplace_back(std::string(name), payload);
  }
  void release() {
    for (auto& [name, payload] : held_) inner_->sendEvent(name, payload);
    held_.clear();
  }
  size_t held() const { return held_.size(); }

 private:
  std::unique_ptr<AnalyticsSink> inner_;
  std::vector<std::pair<std::string, std::function<std::optional<nlohmann::json>()>>> held_;
};

class NoDevice final : public DeviceContextProtocol {
 public:
  std::optional<std::string> localeIdentifier() const override { return std::nullopt; }
  std::optional<std::string> country() const override { return std::nullopt; }
  std::optional<std::string> deviceModel() const override { return std::nullopt; }
  std::optional<std::string> osVersion() const override { return std::nullopt; }
  std::string userAgent() const override { return "test"; }
};

// The composition root reporting losses into the analytics file.
class FeedbackLossAnalytics : public ::testing::Test {
 protected:
  FeedbackLossAnalytics() {
    auto fileSink =
        makeJsonLinesAnalyticsSink(env.dirs.analyticsFile(), *env.fileManager, *env.clock);
    sink = std::make_shared<DeferringSink>(std::move(fileSink));
    FBFAssemblyDependencies deps;
    deps.preferences = env.preferences;
    deps.fileManager = env.fileManager;
    deps.clock = env.clock;
    deps.analytics = sink;
    deps.transactions = env.transactions;
    deps.deviceContext = std::make_shared<NoDevice>();
    deps.workloop = env.manualQueue;
    assembly = std::make_unique<FBFAssembly>(std::move(deps));
  }
  std::vector<nlohmann::json> lines() {
    std::vector<nlohmann::json> out;
    std::ifstream in(env.dirs.analyticsFile());
    for (std::string line; std::getline(in, line);) out.push_back(nlohmann::json::parse(line));
    return out;
  }

  TestEnvironment env;
  std::shared_ptr<DeferringSink> sink;
  std::unique_ptr<FBFAssembly> assembly;
};

TEST_F(FeedbackLossAnalytics, NothingIsWrittenUntilTheSinkAsksForThePayload) {
  assembly->didDeleteFeedbackFile(FeedbackDeletionEvent{2, 5, 3, 600});
  EXPECT_EQ(sink->held(), 1u);
  EXPECT_FALSE(fs::exists(env.dirs.analyticsFile()));

  sink->release();
  auto written = lines();
  ASSERT_EQ(written.size(), 1u);
  EXPECT_EQ(written[0].at("event"), "vireond.feedbackLoss");
  EXPECT_EQ(written[0].at("payload"),
            (nlohmann::json{{"feedbackType", 2}, {"reason", 5}, {"size", 3}, {"age", 600}}));
}

TEST_F(FeedbackLossAnalytics, OneLinePerEventInOrder) {
  auto file = makeFile(env.cacheDir(), "dropped", std::string(1025, 'x'));
  auto event = FeedbackDeletionEvent::make(file, 11, FeedbackDeletionReason::tooOld,
                                           creationDate(*env.fileManager, file) + 8 * 86400s,
                                           *env.fileManager);
  ASSERT_TRUE(event);
  assembly->didDeleteFeedbackFile(*event);
  assembly->didDeleteFeedbackFile(FeedbackDeletionEvent{13, 12, 0, 0});
  sink->release();
  auto written = lines();
  ASSERT_EQ(written.size(), 2u);
  EXPECT_EQ(written[0].at("payload"),
            (nlohmann::json{{"feedbackType", 11}, {"reason", 1}, {"size", 2}, {"age", 8 * 86400}}));
  EXPECT_EQ(written[1].at("payload").at("feedbackType"), 13);
  EXPECT_EQ(written[1].at("payload").size(), 4u);
}

}  // namespace
}  // namespace fbf::testing
