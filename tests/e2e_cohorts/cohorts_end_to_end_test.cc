// Usage cohorts end to end: generated sessions are counted by a real daemon,
// a later flush (the daemon's clock moved forward with libfaketime)
// aggregates the days that have passed, and the flush after that uploads
// the usage envelopes to a real receiver over HTTPS.
#include "e2e/daemon_home.h"

#include "corevireon.pb.h"

#include <glob.h>

#include <google/protobuf/util/json_util.h>

#include <ctime>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;
using corevireon::CVCohortsFeedback;
using corevireon::CVUsageEnvelope;

constexpr int64_t kDay = 86400;
// Three whole days pass for the daemon, and half an hour into the fourth:
// every day, week or month boundary is then either under an hour old (its
// coin never comes up) or at least a day old (it always does), so the
// number of aggregated periods does not depend on chance.
constexpr int64_t kDaysForward = 4;
constexpr int64_t kIntoTheDay = 1800;
constexpr int kSessions = 24;

std::string utcText(int64_t secondsSince1970, const char* format) {
  std::time_t t = secondsSince1970;
  std::tm tm{};
  gmtime_r(&t, &tm);
  char text[64];
  std::strftime(text, sizeof text, format, &tm);
  return text;
}

template <class Message>
Message fromJson(const nlohmann::json& json) {
  Message m;
  auto status = google::protobuf::util::JsonStringToMessage(json.dump(), &m);
  EXPECT_TRUE(status.ok()) << status.ToString() << " in " << json.dump();
  return m;
}

// Guards against: usage not counted by the real daemon, due days not aggregated (or not yet due ones aggregated) after days pass, envelopes not teed, not uploaded or not deleted after upload, or a store file others can read.
class CohortsAcrossDays : public ::testing::Test {
 protected:
  void SetUp() override {
    glob_t found{};
    if (glob("/usr/lib/*/faketime/libfaketimeMT.so.1", 0, nullptr, &found) == 0 && found.gl_pathc > 0) {
      faketime_ = found.gl_pathv[0];
    }
    globfree(&found);
    if (faketime_.empty()) GTEST_SKIP() << "libfaketime (Debian package faketime) is not installed";
    receiver_ = std::make_unique<Receiver>(home_.root());
    ASSERT_TRUE(receiver_->running());
    // A periodic run has just happened: the later daemon must not flush on
    // its own at launch, before the cohorts listener is there.
    home_.configure(receiver_->url(), {{"cohorts_lookback_in_days", 56}});
    fs::create_directory(cohortsDir());
    fs::permissions(cohortsDir(), fs::perms::owner_all);
    realNow_ = static_cast<int64_t>(std::time(nullptr));
    day0_ = realNow_ / kDay * kDay;
    // Day arithmetic below is plain UTC; no daylight saving day in between.
    // The faked clock is at the fourth day, for every process started with
    // it; timers and waits keep real monotonic time, file times stay real,
    // and the preloaded library comes before the sanitizer runtime.
    const char* asan = std::getenv("ASAN_OPTIONS");
    faked_ = {"/usr/bin/env", "TZ=UTC", "LD_PRELOAD=" + faketime_,
              "FAKETIME=@" + utcText(day0_ + kDaysForward * kDay + kIntoTheDay, "%Y-%m-%d %H:%M:%S"),
              "DONT_FAKE_MONOTONIC=1", "NO_FAKE_STAT=1",
              "ASAN_OPTIONS=" + std::string(asan ? asan + std::string(":") : "") + "verify_asan_link_order=0"};
  }

  fs::path cohortsDir() const { return home_.cacheDir() / "Cohorts"; }
  fs::path usageDir() const { return home_.customDir() / "Usage"; }
  RunResult fbfctl(const std::vector<std::string>& args) {
    auto run = home_.fbfctl(args);
    EXPECT_EQ(run.status, 0) << "fbfctl " << args.front() << ": " << run.err;
    return run;
  }
  nlohmann::json cohortsStatus() { return nlohmann::json::parse(fbfctl({"status", "--json"}).out)["cohorts"]; }
  std::vector<nlohmann::json> uploads(const std::string& type) const {
    auto all = receiver_->records();
    std::erase_if(all, [&](const nlohmann::json& r) { return r["type"] != type; });
    return all;
  }
  size_t usageFilesLeft() const {
    if (!fs::exists(usageDir())) return 0;
    return static_cast<size_t>(std::distance(fs::directory_iterator(usageDir()), fs::directory_iterator()));
  }

  DaemonHome home_;
  std::unique_ptr<Receiver> receiver_;
  std::string faketime_;
  std::vector<std::string> faked_;
  int64_t realNow_ = 0, day0_ = 0;
};

TEST_F(CohortsAcrossDays, DueDaysAreAggregatedTeedAndUploaded) {
  // Session starts spread over the four days the daemon will look back on.
  std::vector<std::string> args(faked_.begin() + 1, faked_.end());
  args.insert(args.end(), {(binDir() / "fbf-sessiongen").string(), "--out", home_.cacheDir().string(), "--sessions",
                           std::to_string(kSessions), "--custom", "0", "--seed", "23", "--size-mix", "small", "--days", std::to_string(kDaysForward)});
  auto generated = runProgram(faked_.front(), args, home_.environment());
  if (generated.status != 0 && generated.err.find("AddressSanitizer") != std::string::npos) {
    GTEST_SKIP() << "the sanitizer runtime refuses the preloaded libfaketime: " << generated.err;
  }
  ASSERT_EQ(generated.status, 0) << generated.err;

  // --- First flush, today: sessions counted, nothing due yet -------------
  home_.startDaemon({"/usr/bin/env", "TZ=UTC"});
  fbfctl({"flush"});
  EXPECT_EQ(uploads("FeedbackV2PB").size(), static_cast<size_t>(kSessions)) << home_.daemonLog();
  EXPECT_TRUE(uploads("Usage").empty());
  EXPECT_EQ(usageFilesLeft(), 0u) << "the first hour never generates";
  auto status = cohortsStatus();
  ASSERT_TRUE(status.is_object());
  const double collectionStart = status["collectionStart"].get<double>();
  EXPECT_NEAR(collectionStart, static_cast<double>(realNow_), 120.0);
  for (const char* frequency : {"daily", "weekly", "monthly"}) {
    EXPECT_DOUBLE_EQ(status["lastAggregations"][frequency].get<double>(), collectionStart) << frequency;
  }
  uint64_t sentinelsCounted = 0;
  for (const auto& s : status["sentinels"]) sentinelsCounted += s["count"].get<uint64_t>();
  EXPECT_GT(sentinelsCounted, 0u);
  EXPECT_EQ(home_.stopDaemon(), 0);

  // --- Second flush, days later: every due period aggregated -------------
  home_.startDaemon(faked_);
  const fs::path teeOut = home_.root() / "tee.out";
  auto tee = home_.startFbfctl({"tee", "cohorts", "--count", "12"}, teeOut);
  ASSERT_TRUE(waitUntil([&] { return readFile(teeOut.string() + ".err").find("listening") != std::string::npos; }, 20s));
  fbfctl({"flush"});
  ASSERT_EQ(tee->waitFor(20s), 0) << readFile(teeOut.string() + ".err") << home_.daemonLog();
  const size_t generatedFiles = usageFilesLeft();
  EXPECT_GE(generatedFiles, 12u) << home_.daemonLog();
  EXPECT_TRUE(uploads("Usage").empty()) << "generated at the end of the walk, uploaded by the next flush";

  // The three whole days, in order, each with the surfaces 2, 1, 4, 3.
  auto teed = jsonLines(teeOut);
  ASSERT_EQ(teed.size(), 12u);
  std::vector<int> teedClients;
  std::set<std::string> teedUuids;
  for (size_t i = 0; i < teed.size(); ++i) {
    auto envelope = fromJson<CVUsageEnvelope>(teed[i]["payload"]);
    teedClients.push_back(envelope.client());
    EXPECT_EQ(envelope.collectionendtimestamp(), day0_ + static_cast<int64_t>(i / 4 + 1) * kDay);
    EXPECT_EQ(envelope.configuredlookbacktimeindays(), 1);
    teedUuids.insert(envelope.uuid());
  }
  EXPECT_EQ(teedClients, (std::vector<int>{2, 1, 4, 3, 2, 1, 4, 3, 2, 1, 4, 3}));
  EXPECT_EQ(teedUuids.size(), 12u);
  EXPECT_DOUBLE_EQ(cohortsStatus()["lastAggregations"]["daily"].get<double>(), static_cast<double>(day0_ + 3 * kDay))
      << "the fourth day is under an hour old";

  // --- Third flush: the envelopes reach the receiver ---------------------
  fbfctl({"flush"});
  auto usage = uploads("Usage");
  ASSERT_EQ(usage.size(), generatedFiles) << home_.daemonLog();
  EXPECT_EQ(usageFilesLeft(), 0u);

  std::set<std::string> uploadedDailyUuids;
  uint32_t dailyActiveDays = 0;
  for (const auto& record : usage) {
    EXPECT_TRUE(record["digest_ok"].get<bool>());
    auto feedback = fromJson<CVCohortsFeedback>(record["decoded"]);
    if (feedback.has_propensityenvelope()) continue;
    const auto& e = feedback.usageenvelope();
    EXPECT_EQ(e.collectionstarttimestamp(), static_cast<int64_t>(collectionStart));
    if (e.configuredlookbacktimeindays() == 1) {
      uploadedDailyUuids.insert(e.uuid());
      dailyActiveDays += e.usagesincelookback().activedaysincollectionperiod();
    }
  }
  EXPECT_EQ(uploadedDailyUuids, teedUuids) << "the listener saw exactly the daily envelopes uploaded";
  EXPECT_GT(dailyActiveDays, 0u);

  EXPECT_EQ(fs::status(cohortsDir() / "cohorts.sqlite").permissions(), fs::perms::owner_read | fs::perms::owner_write);
}

}  // namespace
}  // namespace fbf::testing
