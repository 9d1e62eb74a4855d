// The daemon's main job with the real programs: vireon-fbf flushes what
// fbf-sessiongen wrote to fbf-ingest over HTTPS on loopback, driven by fbfctl.
#include "e2e/daemon_home.h"
#include "upload/upload_manager.h"

#include <gtest/gtest.h>
#include <signal.h>

#include <fstream>
#include <map>
#include <set>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

constexpr int kTooOld = 1, kTooLarge = 2, kEmpty = 3, kPruned = 4;
// Reported for every file the receiver accepted; not a loss.
constexpr int kUploaded = 12;
constexpr uint64_t kSessionSizeLimit = 2'097'152;

std::string uuid(unsigned n) {
  char buf[40];
  std::snprintf(buf, sizeof buf, "%08X-1111-4222-8333-444455556666", n);
  return buf;
}
std::string session(unsigned n, const std::string& state) { return "session.4242." + uuid(n) + "." + state; }

// Deletion events of files dropped without being delivered, by reason.
std::map<int, int> losses(const std::vector<nlohmann::json>& events) {
  std::map<int, int> out;
  for (const auto& e : events) {
    if (e.at("reason").get<int>() != kUploaded) ++out[e.at("reason").get<int>()];
  }
  return out;
}

std::multiset<std::string> typesOf(const std::vector<nlohmann::json>& records) {
  std::multiset<std::string> out;
  for (const auto& r : records) out.insert(r.value("type", ""));
  return out;
}

size_t countEndingWith(const std::vector<std::string>& names, std::string_view suffix) {
  size_t n = 0;
  for (const auto& name : names) n += name.ends_with(suffix);
  return n;
}

std::string summary(const std::vector<nlohmann::json>& records) {
  std::string out;
  for (const auto& r : records) {
    out += r.value("type", "?") + " " + r["status"].dump() + " " + r.value("digest_kind", "?") + " " +
           r["query"].dump() + "\n";
  }
  return out;
}

std::string tail(const std::string& text, size_t n = 6000) {
  return text.size() > n ? text.substr(text.size() - n) : text;
}

// A retried upload carries no digest (it was computed while compressing, in
// the earlier run), so the receiver checks that the body inflates and decodes.
bool deliveredIntact(const nlohmann::json& r) {
  return r.value("status", 0) == 200 && r["inflated_size"].is_number() && !r.contains("decode_error");
}

// A home with a receiver; the daemon is started by each case once its
// files are in place.
class FlushEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(LoopbackCertificate::get().made) << "openssl could not make a certificate";
    receiver = std::make_unique<Receiver>(home.root());
    ASSERT_TRUE(receiver->running());
    home.configure(receiver->url());
  }

  // The expected fate of every custom file, by its size against the limits.
  struct CustomCensus {
    std::multiset<std::string> validTypes;
    int empty = 0, tooLarge = 0;
  };
  CustomCensus census(const std::map<std::string, uint64_t>& limits) {
    CustomCensus c;
    for (const auto& rel : home.customFiles()) {
      std::string type = fs::path(rel).begin()->string();
      auto size = fs::file_size(home.customDir() / rel);
      auto it = limits.find(type);
      uint64_t limit = it == limits.end() ? kSessionSizeLimit : it->second;
      if (size == 0) {
        ++c.empty;
      } else if (size > limit) {
        ++c.tooLarge;
      } else {
        c.validTypes.insert(type);
      }
    }
    return c;
  }

  std::string flushOrFail() {
    auto r = home.fbfctl({"flush"});
    EXPECT_EQ(r.status, 0) << r.err << home.daemonLog();
    return r.err;
  }

  DaemonHome home;
  std::unique_ptr<Receiver> receiver;
};

using HealthyReceiver = FlushEndToEnd;

TEST_F(HealthyReceiver, FlushSendsEverythingValidAndDropsTheRestWithDeletionEvents) {
  const std::map<std::string, uint64_t> limits = {{"Pelorus", 200}};
  home.writeBag(receiver->url(), {{"max_custom_feedback_sizes", {{"Pelorus", 200}}}});
  ASSERT_EQ(home.generate(12, 14, 3).status, 0);
  writeFile(home.customDir() / "Quenbury" / "empty", "");
  writeFile(home.customDir() / "Pelorus" / "too-large", std::string(201, 'x'));
  writeFile(home.cacheDir() / session(1, "closed"), std::string(kSessionSizeLimit + 1, '\x0a'));
  auto custom = census(limits);
  ASSERT_GE(custom.empty, 1);
  ASSERT_GE(custom.tooLarge, 1);
  ASSERT_FALSE(custom.validTypes.empty());

  home.startDaemon();
  flushOrFail();

  auto records = receiver->records();
  std::multiset<std::string> expected = custom.validTypes;
  for (int i = 0; i < 12; ++i) expected.insert("FeedbackV2PB");
  EXPECT_EQ(typesOf(records), expected);
  // Custom files may carry any bytes (the generator also writes JSON under
  // protobuf type names), but every session must arrive as a session.
  int sessionsDecoded = 0;
  for (const auto& r : records) {
    const auto& q = r.at("query");
    EXPECT_EQ(q.value("v", ""), "2") << r.dump();
    EXPECT_EQ(q.value("key", ""), std::string(UploadManager::kClientKey)) << r.dump();
    EXPECT_EQ(q.value("realtime", ""), "1") << "a client asked for this flush: " << r.dump();
    sessionsDecoded += q.value("type", "") == "FeedbackV2PB" && r["decoded"].is_object();
    EXPECT_TRUE(r.value("digest_ok", false)) << r.dump();
    EXPECT_EQ(r.value("status", 0), 200) << r.dump();
  }
  EXPECT_EQ(sessionsDecoded, 12);
  EXPECT_TRUE(home.sessionFiles().empty()) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_TRUE(home.customFiles().empty()) << ::testing::PrintToString(home.customFiles());

  auto lost = losses(home.deletionEvents());
  EXPECT_EQ(lost[kEmpty], custom.empty);
  EXPECT_EQ(lost[kTooLarge], custom.tooLarge + 1) << "the oversized session is reported too";
  EXPECT_EQ(lost.size(), 2u) << nlohmann::json(home.deletionEvents()).dump();
}

TEST_F(HealthyReceiver, SessionsOlderThanTheBagsAgeLimitAreDroppedAsTooOld) {
  // An age limit of zero days makes every file already too old.
  home.writeBag(receiver->url(), {{"feedback_max_age_in_days", 0}});
  ASSERT_EQ(home.generate(4, 0, 5).status, 0);
  home.startDaemon();
  flushOrFail();
  EXPECT_TRUE(receiver->records().empty());
  EXPECT_TRUE(home.sessionFiles().empty());
  EXPECT_EQ(losses(home.deletionEvents()), (std::map<int, int>{{kTooOld, 4}}));
}

TEST_F(HealthyReceiver, TeeUploadsReceivesEachPayload) {
  ASSERT_EQ(home.generate(3, 2, 9).status, 0);
  home.startDaemon();
  auto teeOut = home.root() / "tee.jsonl";
  auto tee = home.startFbfctl({"tee", "uploads", "--count", "5"}, teeOut);
  ASSERT_TRUE(waitUntil([&] { return readFile(fs::path(teeOut.string() + ".err")).find("listening") != std::string::npos; },
                        10s));
  flushOrFail();
  auto status = tee->waitFor(20s);
  ASSERT_TRUE(status) << "tee did not end after five payloads";
  EXPECT_EQ(*status, 0);

  std::multiset<std::string> teed;
  std::ifstream in(teeOut);
  for (std::string line; std::getline(in, line);) {
    auto j = nlohmann::json::parse(line, nullptr, false);
    ASSERT_FALSE(j.is_discarded()) << line;
    EXPECT_GT(j.value("bytes", 0), 0) << line;
    teed.insert(j.value("format", ""));
  }
  EXPECT_EQ(teed, typesOf(receiver->records()));
  EXPECT_EQ(teed.size(), 5u);
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

TEST_F(HealthyReceiver, LeftoverSessionFilesArePrunedToFifty) {
  // Files still being processed by someone are never uploaded, so they pile up.
  for (unsigned i = 0; i < 120; ++i) writeFile(home.cacheDir() / session(100 + i, "processing"), "p");
  home.startDaemon();
  flushOrFail();
  EXPECT_EQ(home.sessionFiles().size(), 50u);
  EXPECT_EQ(losses(home.deletionEvents()), (std::map<int, int>{{kPruned, 70}}));
  EXPECT_TRUE(receiver->records().empty());
}

// ---- a receiver that fails, then recovers

using FailingReceiver = FlushEndToEnd;

TEST_F(FailingReceiver, ServerErrorKeepsTheFilesAndALaterFlushRetriesThem) {
  const int port = receiver->port();
  receiver->stop();
  receiver = std::make_unique<Receiver>(home.root(), port, std::vector<std::string>{"--status", "500"});
  ASSERT_TRUE(receiver->running());
  ASSERT_EQ(home.generate(5, 3, 11).status, 0);
  home.startDaemon();
  flushOrFail();

  EXPECT_EQ(receiver->records().size(), 8u);
  EXPECT_EQ(countEndingWith(home.sessionFiles(), ".uploadPending"), 5u) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_EQ(countEndingWith(home.customFiles(), ".uploadPending"), 3u) << ::testing::PrintToString(home.customFiles());
  EXPECT_TRUE(losses(home.deletionEvents()).empty()) << nlohmann::json(home.deletionEvents()).dump();

  receiver->stop();
  receiver = std::make_unique<Receiver>(home.root(), port);
  ASSERT_TRUE(receiver->running());
  flushOrFail();

  size_t ok = 0;
  for (const auto& r : receiver->records()) ok += deliveredIntact(r);
  EXPECT_EQ(ok, 8u) << summary(receiver->records());
  EXPECT_TRUE(home.sessionFiles().empty()) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_TRUE(home.customFiles().empty()) << ::testing::PrintToString(home.customFiles());
  EXPECT_TRUE(losses(home.deletionEvents()).empty()) << nlohmann::json(home.deletionEvents()).dump();
}

TEST_F(FailingReceiver, ReceiverDownCancelsTheFlushAndLosesNothing) {
  const int port = receiver->port();
  receiver->stop();
  ASSERT_EQ(home.generate(6, 3, 13).status, 0);
  home.startDaemon();
  flushOrFail();

  EXPECT_NE(home.daemonLog().find("Device appears to be offline. Flush cancelled."), std::string::npos);
  EXPECT_EQ(home.sessionFiles().size(), 6u) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_EQ(home.customFiles().size(), 3u) << ::testing::PrintToString(home.customFiles());
  EXPECT_TRUE(losses(home.deletionEvents()).empty()) << nlohmann::json(home.deletionEvents()).dump();

  // The cancellation ended that flush only: the next one delivers all.
  receiver = std::make_unique<Receiver>(home.root(), port);
  ASSERT_TRUE(receiver->running());
  flushOrFail();
  std::multiset<std::string> sessionsSent;
  for (const auto& r : receiver->records()) {
    EXPECT_TRUE(deliveredIntact(r)) << summary({r});
    if (r.value("type", "") == "FeedbackV2PB") sessionsSent.insert(r.dump());
  }
  EXPECT_EQ(receiver->records().size(), 9u);
  EXPECT_EQ(sessionsSent.size(), 6u);
  EXPECT_TRUE(home.sessionFiles().empty());
  EXPECT_TRUE(home.customFiles().empty());
}

// ---- termination in the middle of a long flush

using TerminatedFlush = FlushEndToEnd;

TEST_F(TerminatedFlush, SigtermStopsBetweenFilesAndLosesNothing) {
  // Fewer than the pruning bound, so whatever the stop leaves is kept as is.
  constexpr int kSessions = 90;
  // A slow receiver keeps the flush going long enough to be interrupted.
  const int port = receiver->port();
  receiver->stop();
  receiver = std::make_unique<Receiver>(home.root(), port, std::vector<std::string>{"--delay-ms", "30"});
  ASSERT_EQ(home.generate(kSessions, 0, 17, "realistic").status, 0);
  ASSERT_EQ(home.sessionFiles().size(), static_cast<size_t>(kSessions));
  home.startDaemon();

  auto flush = home.startFbfctl({"flush"}, home.root() / "flush.out");
  ASSERT_TRUE(waitUntil([&] { return receiver->records().size() >= 3; }, 30s)) << home.daemonLog();
  auto status = home.stopDaemon();
  ASSERT_TRUE(status) << "the daemon did not exit after SIGTERM";
  EXPECT_EQ(*status, 0) << tail(home.daemonLog());
  flush->waitFor(10s);

  auto left = home.sessionFiles();
  size_t delivered = 0;
  for (const auto& r : receiver->records()) delivered += r.value("status", 0) == 200;
  // A payload delivered just before the exit may also still be on disk.
  EXPECT_GE(left.size() + delivered, static_cast<size_t>(kSessions));
  for (const auto& name : left) {
    EXPECT_FALSE(name.ends_with(".processing")) << "interrupted in the middle of " << name;
  }
  EXPECT_GT(countEndingWith(left, ".closed"), 0u) << "the walk was not stopped";
  EXPECT_TRUE(losses(home.deletionEvents()).empty()) << nlohmann::json(home.deletionEvents()).dump();
}

}  // namespace
}  // namespace fbf::testing
