// The flusher over a real cache directory in a temporary home, with a fake
// upload manager that holds every upload until the test settles it.
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "flusher/fake_upload_manager.h"
#include "flushing/feedback_flusher.h"
#include "flushing/flushing_test_util.h"
#include "processing/processing_builders.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <set>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

constexpr uint64_t kSizeLimit = 2'097'152;
constexpr int kTooOld = 1, kTooLarge = 2, kEmpty = 3, kPruned = 4, kNoConsent = 5;

// A parseable session whose serialised form is exactly `bytes` long (the
// agent string pads it), or as small as possible when `bytes` is 0.
std::string sessionBytes(size_t bytes = 0) {
  corevireon::CVClientSession s;
  *s.mutable_feedbacks()->add_items() = clearInput(1'000'000'000, 7);
  if (bytes == 0) return s.SerializeAsString();
  size_t pad = bytes;
  for (int i = 0; i < 8; ++i) {
    s.set_agent(std::string(pad, 'a'));
    size_t size = s.ByteSizeLong();
    if (size == bytes) return s.SerializeAsString();
    pad = pad + bytes - size;
  }
  ADD_FAILURE() << "cannot make a session of " << bytes << " bytes";
  return {};
}

class FlushWithHeldUploads : public ::testing::Test {
 protected:
  void SetUp() override {
    env.writeBag({{"feedback_url", "https://127.0.0.1:9/feedback"}, {"vireon_feedback_format", "FeedbackV2PB"}});
    setConsent(true);
  }
  // Held completions keep their flusher alive; drop them with the test.
  void TearDown() override { uploads->pending.clear(); }

  void setConsent(bool enabled) {
    env.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::ConsentDomain))
        ->setObject(FBFStrings::LinuxDefaults::DiagnosticsAndUsageEnabled, enabled);
  }

  std::shared_ptr<FeedbackFlusher> makeFlusher() {
    FlusherDependencies deps;
    deps.uploadManagerFactory = [this](FBFAssemblyProtocol&) -> std::unique_ptr<UploadManagerProtocol> {
      auto m = std::make_unique<FakeUploadManager>(uploads);
      manager = m.get();
      return m;
    };
    // Sessions first, then the custom directories, each in directory order.
    deps.randomChoice = [](size_t) { return size_t{0}; };
    return FeedbackFlusher::make(env.assembly(), std::move(deps));
  }

  // Runs a whole walk; uploads stay pending.
  void flush() {
    flusher = makeFlusher();
    flusher->beginEnumeratingFeedback([this] { ++completions; });
    env.manualQueue->drain();
  }

  void settleAll(long status) {
    while (!uploads->pending.empty()) {
      env.manualQueue->async([this, status] { manager->settleOldest(status); });
      env.manualQueue->drain();
    }
  }

  fs::path closedSession(unsigned n, const std::string& bytes) {
    return makeFile(env.cacheDir(), sessionName(SessionFileState::closed, n), bytes);
  }
  fs::path custom(const std::string& type, const std::string& name, const std::string& bytes) {
    auto path = env.cacheDir() / "CustomFeedback" / type / name;
    writeFile(path, bytes);
    return path;
  }

  // Deletion events as (type name, reason).
  std::vector<std::pair<std::string, int>> deletions() const {
    std::vector<std::pair<std::string, int>> out;
    for (const auto& [name, payload] : env.analytics->events()) {
      if (name != FBFStrings::FeedbackLossEventName) continue;
      out.emplace_back(knownFeedbackTypeName(payload.at("feedbackType").get<int>()), payload.at("reason").get<int>());
    }
    return out;
  }
  std::vector<nlohmann::json> deletionPayloads() const {
    std::vector<nlohmann::json> out;
    for (const auto& [name, payload] : env.analytics->events())
      if (name == FBFStrings::FeedbackLossEventName) out.push_back(payload);
    return out;
  }

  TestEnvironment env;
  std::shared_ptr<FakeUploadManager::Log> uploads = std::make_shared<FakeUploadManager::Log>();
  FakeUploadManager* manager = nullptr;
  std::shared_ptr<FeedbackFlusher> flusher;
  int completions = 0;
};

using Pairs = std::vector<std::pair<std::string, int>>;

// ---- the two limits of a session file: age first, then size

using SessionAtTheLimits = FlushWithHeldUploads;

TEST_F(SessionAtTheLimits, ExactlyTheSizeLimitIsUploaded) {
  auto file = closedSession(1, sessionBytes(kSizeLimit));
  ASSERT_EQ(fs::file_size(file), kSizeLimit);
  flush();
  ASSERT_EQ(uploads->prepared.size(), 1u);
  EXPECT_EQ(uploads->prepared[0].second, "FeedbackV2PB");
  EXPECT_EQ(uploads->pending.size(), 1u);
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(deletions().empty());
}

TEST_F(SessionAtTheLimits, OneByteOverIsDiscardedAsTooLargeWithADeletionEvent) {
  LogCapture logs;
  auto file = closedSession(1, sessionBytes(kSizeLimit + 1));
  flush();
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_FALSE(fs::exists(file));
  EXPECT_FALSE(fs::exists(env.cacheDir() / sessionName(SessionFileState::processing, 1)));
  EXPECT_EQ(deletions(), (Pairs{{"FeedbackV2PB", kTooLarge}}));
  // Reported in KiB, rounded up: one byte over shows as one KiB over.
  EXPECT_EQ(deletionPayloads().at(0).at("size").get<uint64_t>(), kSizeLimit / 1024 + 1);
  EXPECT_TRUE(logs.contains("because size exceeds maximum size 2048KB"));
}

TEST_F(SessionAtTheLimits, EightDaysOldIsDiscardedAsTooOld) {
  auto file = closedSession(1, sessionBytes());
  env.clock->advance(std::chrono::hours(24 * 8));
  flush();
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_FALSE(fs::exists(file));
  EXPECT_EQ(deletions(), (Pairs{{"FeedbackV2PB", kTooOld}}));
}

TEST_F(SessionAtTheLimits, SixDaysOldIsStillUploaded) {
  closedSession(1, sessionBytes());
  env.clock->advance(std::chrono::hours(24 * 6));
  flush();
  EXPECT_EQ(uploads->prepared.size(), 1u);
  EXPECT_TRUE(deletions().empty());
}

TEST_F(SessionAtTheLimits, AgeIsJudgedBeforeSize) {
  closedSession(1, sessionBytes(kSizeLimit + 1));
  env.clock->advance(std::chrono::hours(24 * 8));
  flush();
  EXPECT_EQ(deletions(), (Pairs{{"FeedbackV2PB", kTooOld}}));
}

TEST_F(SessionAtTheLimits, UndecodableSessionIsNeitherUploadedNorReportedAsLost) {
  closedSession(1, std::string("\xff\xff\xff garbage", 12));
  flush();
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_TRUE(deletions().empty());
}

// ---- custom feedback validation and consent

using CustomFeedbackChecks = FlushWithHeldUploads;

TEST_F(CustomFeedbackChecks, ZeroByteFileIsDiscardedAsEmpty) {
  LogCapture logs;
  auto file = custom("Pelorus", "empty", "");
  flush();
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_EQ(deletions(), (Pairs{{"Pelorus", kEmpty}}));
  EXPECT_TRUE(logs.contains("discarding Pelorus custom feedback because it's empty"));
}

TEST_F(CustomFeedbackChecks, FileOverItsTypesLimitIsDiscardedAsTooLarge) {
  env.writeBag({{"feedback_url", "https://127.0.0.1:9/feedback"}, {"max_custom_feedback_sizes", {{"Pelorus", 10}}}});
  auto fits = custom("Pelorus", "a-fits", "0123456789");
  auto over = custom("Pelorus", "b-over", "0123456789A");
  flush();
  ASSERT_EQ(uploads->prepared.size(), 1u);
  EXPECT_EQ(uploads->prepared[0].first, fits);
  EXPECT_FALSE(fs::exists(over));
  EXPECT_EQ(deletions(), (Pairs{{"Pelorus", kTooLarge}}));
}

TEST_F(CustomFeedbackChecks, ValidFileIsPreparedUnderItsTypeAndRemoved) {
  auto file = custom("Quenbury", "q1", R"({"k":1})");
  flush();
  ASSERT_EQ(uploads->prepared.size(), 1u);
  EXPECT_EQ(uploads->prepared[0], (std::pair<fs::path, std::string>{file, "Quenbury"}));
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(deletions().empty());
}

TEST_F(CustomFeedbackChecks, WithoutConsentOnlyTheUserReportIsSent) {
  setConsent(false);
  auto pelorus = custom("Pelorus", "p1", "{}");
  auto report = custom("UserReport", "r1", "{\"text\":\"it broke\"}");
  flush();
  ASSERT_EQ(uploads->prepared.size(), 1u);
  EXPECT_EQ(uploads->prepared[0].first, report);
  EXPECT_FALSE(fs::exists(pelorus));
  EXPECT_EQ(deletions(), (Pairs{{"Pelorus", kNoConsent}}));
}

// ---- what the walk leaves alone or only retries

using FilesInOtherStates = FlushWithHeldUploads;

TEST_F(FilesInOtherStates, PendingUploadsAreRetriedNeverCompressedAgain) {
  SessionFilename name = *SessionFilename::fromString(sessionName(SessionFileState::processing, 3));
  name.uploadFormat = UploadFormat::pb;
  auto sessionUpload = makeFile(env.cacheDir(), name.uploadFilenameString(), "compressed-session");
  auto customUpload = custom("Pelorus", "p1.uploadPending", "compressed-custom");
  flush();
  EXPECT_TRUE(uploads->prepared.empty());
  std::set<std::pair<fs::path, std::string>> retried(uploads->retried.begin(), uploads->retried.end());
  EXPECT_EQ(retried, (std::set<std::pair<fs::path, std::string>>{{sessionUpload, "FeedbackV2PB"},
                                                                 {customUpload, "Pelorus"}}));
  EXPECT_EQ(readFile(sessionUpload), "compressed-session");
  EXPECT_EQ(readFile(customUpload), "compressed-custom");
  EXPECT_TRUE(deletions().empty());
}

TEST_F(FilesInOtherStates, OpenProcessingAndUploadedSessionsAreLeftAlone) {
  auto open = makeFile(env.cacheDir(), sessionName(SessionFileState::open, 1), sessionBytes());
  auto processing = makeFile(env.cacheDir(), sessionName(SessionFileState::processing, 2), sessionBytes());
  auto uploaded = makeFile(env.cacheDir(), sessionName(SessionFileState::uploaded, 3), sessionBytes());
  flush();
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_TRUE(uploads->retried.empty());
  EXPECT_TRUE(fs::exists(open));
  EXPECT_TRUE(fs::exists(processing));
  EXPECT_TRUE(fs::exists(uploaded));
  EXPECT_TRUE(deletions().empty());
  EXPECT_EQ(completions, 1);
}

TEST_F(FilesInOtherStates, WithoutABagNothingIsTouched) {
  fs::remove(env.cacheDir() / "bag.plist");
  LogCapture logs;
  auto session = closedSession(1, sessionBytes(kSizeLimit + 1));
  auto empty = custom("Pelorus", "empty", "");
  for (unsigned i = 10; i < 130; ++i) makeFile(env.cacheDir(), sessionName(SessionFileState::processing, i));
  auto before = entryNames(env.cacheDir());
  flush();
  EXPECT_EQ(entryNames(env.cacheDir()), before);
  EXPECT_TRUE(fs::exists(session));
  EXPECT_TRUE(fs::exists(empty));
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_TRUE(deletions().empty());
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(logs.contains("Flusher didn't find a cached bag, bailing on this flush"));
}

// ---- completion: once, and only after the uploads have settled

using FlushCompletion = FlushWithHeldUploads;

TEST_F(FlushCompletion, WaitsForEveryEnqueuedUpload) {
  closedSession(1, sessionBytes());
  closedSession(2, sessionBytes());
  custom("Pelorus", "p1", "{}");
  flush();
  ASSERT_EQ(uploads->pending.size(), 3u);
  EXPECT_EQ(completions, 0);
  env.manualQueue->async([this] { manager->settleOldest(200); });
  env.manualQueue->drain();
  EXPECT_EQ(completions, 0) << "two uploads are still in flight";
  settleAll(200);
  EXPECT_EQ(completions, 1);
}

TEST_F(FlushCompletion, FailedUploadsSettleTooAndLeaveTheirUploadFiles) {
  closedSession(1, sessionBytes());
  flush();
  ASSERT_EQ(uploads->pending.size(), 1u);
  auto uploadFile = uploads->pending.front().request.fileURL;
  settleAll(500);
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(fs::exists(uploadFile));
}

TEST_F(FlushCompletion, IsCalledExactlyOnceWhenNothingWasEnqueued) {
  flush();
  EXPECT_EQ(completions, 1);
  // A late delegate call (an upload of someone else) does not complete again.
  env.manualQueue->async([this] { flusher->uploadManagerDidUploadFile(env.cacheDir() / "x", 200); });
  env.manualQueue->drain();
  EXPECT_EQ(completions, 1);
}

TEST_F(FlushCompletion, StopEndsTheWalkBetweenFiles) {
  std::vector<fs::path> files;
  for (unsigned i = 1; i <= 5; ++i) files.push_back(closedSession(i, sessionBytes()));
  // The stop arrives while the first file is being handed to the uploader.
  uploads->onEnqueue = [this] { flusher->stopEnumeratingFeedback(); };
  flush();
  ASSERT_EQ(uploads->prepared.size(), 1u);
  size_t stillClosed = 0;
  for (const auto& f : files) stillClosed += fs::exists(f);
  EXPECT_EQ(stillClosed, 4u) << "the walk went on after the stop";
  EXPECT_EQ(completions, 0);
  settleAll(200);
  EXPECT_EQ(completions, 1);
}

// ---- pruning after the walk

using LeftoverSessions = FlushWithHeldUploads;

TEST_F(LeftoverSessions, HundredAndTwentyLeftAreCutToFifty) {
  for (unsigned i = 0; i < 120; ++i) makeFile(env.cacheDir(), sessionName(SessionFileState::processing, i));
  flush();
  size_t left = 0;
  for (const auto& n : entryNames(env.cacheDir())) left += n.starts_with("session.");
  EXPECT_EQ(left, 50u);
  auto events = deletions();
  EXPECT_EQ(events.size(), 70u);
  for (const auto& [type, reason] : events) EXPECT_EQ(reason, kPruned);
  EXPECT_EQ(completions, 1);
}

}  // namespace
}  // namespace fbf::testing
