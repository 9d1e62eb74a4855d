#include "assembly/feedback_deletion_event.h"
#include "assembly/fbf_assembly.h"
#include "flushing/cache_fixture.h"
#include "platform/analytics.h"

#include <fstream>

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// Guards against: a loss record with the wrong size or age, or one sent for an
// unknown type or a file that is already gone.
using FeedbackLossRecord = CacheTest;

TEST_F(FeedbackLossRecord, SizeInKibibytesRoundedUpAndAgeTruncatedTowardZero) {
  struct Row {
    size_t bytes;
    std::chrono::milliseconds after;
    int32_t type;
    std::optional<int64_t> size, age;
  };
  const Row rows[] = {{0, 5s, 2, 0, 5},           {1, 5s, 2, 1, 5},           {1024, 5s, 2, 1, 5},
                      {1025, 90900ms, 11, 2, 90}, {3073, -2500ms, 13, 4, -2}, {1, 0s, 1, 1, 0},
                      {10, 0s, 0, {}, {}},        {10, 0s, 14, {}, {}}};
  for (const auto& row : rows) {
    SCOPED_TRACE(::testing::Message() << row.bytes << " bytes, type " << row.type);
    auto file = makeFile(cache(), "f", std::string(row.bytes, 'b'));
    auto event = FeedbackDeletionEvent::make(file, row.type, FeedbackDeletionReason::tooLarge,
                                             creationDate(fm(), file) + row.after, fm());
    ASSERT_EQ(event.has_value(), row.size.has_value());
    if (!event) continue;
    EXPECT_EQ(event->size, *row.size);
    EXPECT_EQ(event->age, *row.age);
    EXPECT_EQ(event->feedbackType, row.type);
    EXPECT_EQ(event->reason, FeedbackDeletionReason::tooLarge);
  }
  EXPECT_FALSE(FeedbackDeletionEvent::make(cache() / "missing", 2, 1, env.clock->now(), fm()));
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

 private:
  std::unique_ptr<AnalyticsSink> inner_;
  std::vector<std::pair<std::string, std::function<std::optional<nlohmann::json>()>>> held_;
};

// Guards against: a loss reported with a payload that is not the event's own,
// computed before the sink asks for it, or written to the analytics file out of order.
TEST_F(CacheTest, LossesReachTheAnalyticsFileOneLineEachInOrderWhenTheSinkAsks) {
  auto sink = std::make_shared<DeferringSink>(
      makeJsonLinesAnalyticsSink(env.dirs.analyticsFile(), fm(), *env.clock));
  FBFAssemblyDependencies deps;
  deps.preferences = env.preferences;
  deps.fileManager = env.fileManager;
  deps.clock = env.clock;
  deps.analytics = sink;
  deps.transactions = env.transactions;
  deps.deviceContext = std::shared_ptr<DeviceContextProtocol>(
      const_cast<DeviceContextProtocol*>(&env.assembly().deviceContext()), [](auto*) {});
  deps.workloop = env.manualQueue;
  FBFAssembly assembly(std::move(deps));

  assembly.didDeleteFeedbackFile(FeedbackDeletionEvent{11, 1, 2, 8 * 86400});
  assembly.didDeleteFeedbackFile(FeedbackDeletionEvent{13, 12, 0, -3});
  EXPECT_FALSE(fs::exists(env.dirs.analyticsFile()));
  sink->release();

  std::ifstream in(env.dirs.analyticsFile());
  std::vector<nlohmann::json> lines;
  for (std::string line; std::getline(in, line);) lines.push_back(nlohmann::json::parse(line));
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].at("event"), "vireond.feedbackLoss");
  EXPECT_EQ(lines[0].at("payload"),
            (nlohmann::json{{"feedbackType", 11}, {"reason", 1}, {"size", 2}, {"age", 8 * 86400}}));
  EXPECT_EQ(lines[1].at("payload"),
            (nlohmann::json{{"feedbackType", 13}, {"reason", 12}, {"size", 0}, {"age", -3}}));
}

}  // namespace
}  // namespace fbf::testing
