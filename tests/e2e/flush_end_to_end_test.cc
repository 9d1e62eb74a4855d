// The daemon's main job with the real programs: vireon-fbf flushes what
// fbf-sessiongen wrote to fbf-ingest over HTTPS on loopback, driven by fbfctl.
#include "e2e/daemon_home.h"
#include "upload/upload_manager.h"

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

constexpr uint64_t kSessionSizeLimit = 2'097'152;

std::string session(unsigned n, const std::string& state) {
  char buf[80];
  std::snprintf(buf, sizeof buf, "session.4242.%08X-1111-4222-8333-444455556666.%s", n, state.c_str());
  return buf;
}

std::multiset<std::string> typesOf(const std::vector<nlohmann::json>& records) {
  std::multiset<std::string> out;
  for (const auto& r : records) out.insert(r.value("type", ""));
  return out;
}

// A retried upload carries no digest (it was computed while compressing, in
// the earlier run), so the receiver checks that the body inflates and decodes.
size_t deliveredIntact(const std::vector<nlohmann::json>& records) {
  size_t n = 0;
  for (const auto& r : records) {
    n += r.value("status", 0) == 200 && r["inflated_size"].is_number() && !r.contains("decode_error");
  }
  return n;
}

// Guards against: a valid file not uploaded, a dropped file not reported (or
// reported under the wrong reason), a wrong query or digest on the request.
using HealthyReceiver = ReceiverTest;

TEST_F(HealthyReceiver, FlushSendsEverythingValidAndDropsTheRestWithDeletionEvents) {
  home.writeBag(receiver->url(), {{"max_custom_feedback_sizes", {{"Pelorus", 200}}}});
  ASSERT_EQ(home.generate(8, 10, 3).status, 0);
  writeFile(home.customDir() / "Quenbury" / "empty", "");
  writeFile(home.customDir() / "Pelorus" / "too-large", std::string(201, 'x'));
  writeFile(home.cacheDir() / session(1, "closed"), std::string(kSessionSizeLimit + 1, '\x0a'));
  // The expected fate of every custom file, by its size against the limits.
  std::multiset<std::string> expected;
  for (int i = 0; i < 8; ++i) expected.insert("FeedbackV2PB");
  int empty = 0, tooLarge = 1;  // the oversized session
  for (const auto& rel : home.customFiles()) {
    const std::string type = fs::path(rel).begin()->string();
    const auto size = fs::file_size(home.customDir() / rel);
    if (size == 0) {
      ++empty;
    } else if (size > (type == "Pelorus" ? 200 : kSessionSizeLimit)) {
      ++tooLarge;
    } else {
      expected.insert(type);
    }
  }

  home.startDaemon();
  // The listener of `fbfctl tee uploads` sees every payload sent.
  const auto teeOut = home.root() / "tee.jsonl";
  auto tee = home.startFbfctl({"tee", "uploads", "--count", std::to_string(expected.size())}, teeOut);
  ASSERT_TRUE(waitUntil([&] { return readFile(teeOut.string() + ".err").find("listening") != std::string::npos; }, 10s));
  flush();
  ASSERT_EQ(tee->waitFor(20s), 0) << "tee did not end after every payload";
  std::multiset<std::string> teed;
  for (const auto& j : jsonLines(teeOut)) {
    EXPECT_GT(j.value("bytes", 0), 0) << j.dump();
    teed.insert(j.value("format", ""));
  }
  EXPECT_EQ(teed, expected);

  const auto records = receiver->records();
  EXPECT_EQ(typesOf(records), expected);
  // Custom files may carry any bytes, but every session must arrive as one.
  int sessionsDecoded = 0;
  for (const auto& r : records) {
    const auto& q = r.at("query");
    EXPECT_EQ(q.value("v", ""), "2") << r.dump();
    EXPECT_EQ(q.value("key", ""), std::string(UploadManager::kClientKey)) << r.dump();
    EXPECT_EQ(q.value("realtime", ""), "1") << "a client asked for this flush: " << r.dump();
    sessionsDecoded += q.value("type", "") == "FeedbackV2PB" && r["decoded"].is_object();
    EXPECT_TRUE(r.value("digest_ok", false)) << r.dump();
  }
  EXPECT_EQ(delivered(records), records.size());
  EXPECT_EQ(sessionsDecoded, 8);
  EXPECT_TRUE(home.sessionFiles().empty()) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_TRUE(home.customFiles().empty()) << ::testing::PrintToString(home.customFiles());
  EXPECT_EQ(lossesByReason(home.deletionEvents()), (std::map<int, int>{{kTooLarge, tooLarge}, {kEmpty, empty}}));
}

TEST_F(HealthyReceiver, FlushSessionIsRefusedOutsideTheCacheDirectory) {
  auto outside = home.root() / session(2, "closed");
  writeFile(outside, "x");
  home.startDaemon();
  auto r = home.fbfctl({"flush-session", outside.string()});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.err.find("not in the cache directory"), std::string::npos) << r.err;
  EXPECT_TRUE(fs::exists(outside));
  EXPECT_TRUE(receiver->records().empty());
}

// Guards against: files lost or reported dropped when the receiver is
// unreachable, and upload files that a later flush does not retry.
using FailingReceiver = ReceiverTest;

TEST_F(FailingReceiver, ReceiverDownCancelsTheFlushAndLosesNothing) {
  receiver->stop();
  ASSERT_EQ(home.generate(6, 3, 13).status, 0);
  home.startDaemon();
  flush();
  EXPECT_NE(home.daemonLog().find("Device appears to be offline. Flush cancelled."), std::string::npos);
  EXPECT_EQ(home.sessionFiles().size(), 6u) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_EQ(home.customFiles().size(), 3u) << ::testing::PrintToString(home.customFiles());
  EXPECT_EQ(lossCount(home.deletionEvents()), 0);

  // The cancellation ended that flush only: the next one delivers all, once.
  restartReceiver();
  flush();
  const auto records = receiver->records();
  EXPECT_EQ(deliveredIntact(records), 9u);
  EXPECT_EQ(records.size(), 9u);
  EXPECT_TRUE(home.sessionFiles().empty());
  EXPECT_TRUE(home.customFiles().empty());
}

}  // namespace
}  // namespace fbf::testing
