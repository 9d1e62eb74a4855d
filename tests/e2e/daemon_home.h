// A throw-away home in which the real daemon, receiver and command-line
// tools run against each other over HTTPS on loopback.
#pragma once

#include "support/process.h"
#include "support/test_support.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf::testing {

// A key and self-signed certificate for 127.0.0.1, made once per run with
// the openssl command-line tool; valid for days the faked clocks move ahead.
struct LoopbackCertificate {
  static const LoopbackCertificate& get();
  fs::path cert;
  fs::path key;
  bool made = false;
};

// One fbf-ingest process; the record file survives restarts on the same
// port, so a test can take the receiver down and bring it back.
class Receiver {
 public:
  // `port` 0 picks a free one; `extra` are fault options ("--status 500").
  Receiver(const fs::path& dir, int port = 0, std::vector<std::string> extra = {});
  bool running() const { return port_ > 0; }
  int port() const { return port_; }
  std::string url() const { return "https://127.0.0.1:" + std::to_string(port_) + "/feedback"; }
  // One JSON object per request received so far.
  std::vector<nlohmann::json> records() const;
  void stop();

 private:
  fs::path recordFile_;
  std::unique_ptr<ChildProcess> process_;
  int port_ = 0;
};

class DaemonHome {
 public:
  DaemonHome();
  ~DaemonHome();

  fs::path cacheDir() const { return dirs_.cacheHome / "vireond"; }
  fs::path customDir() const { return cacheDir() / "CustomFeedback"; }
  const fs::path& root() const { return home_.path(); }

  // bag.plist pointing at `url` (plus `extra` keys), the receiver's
  // certificate, consent, no exit after a flush, and a periodic run that
  // has just happened, so nothing but the test starts a flush.
  void configure(const std::string& url, const nlohmann::json& extra = nlohmann::json::object());
  void writeBag(const std::string& url, const nlohmann::json& extra = nlohmann::json::object());

  // Starts the daemon and waits until it serves its socket. A `wrapper`
  // command, when given, runs the daemon (appended as its last argument).
  void startDaemon(const std::vector<std::string>& wrapper = {});
  // A wrapper that runs the daemon under RLIMIT_NOFILE `limit` (`ulimit -n`).
  static std::vector<std::string> descriptorLimit(int limit);
  // SIGTERM; the exit status, if it ended in time.
  std::optional<int> stopDaemon();
  ChildProcess* daemon() { return daemon_.get(); }
  std::string daemonLog() const;

  RunResult fbfctl(const std::vector<std::string>& args, std::chrono::milliseconds timeout = std::chrono::seconds(60));
  std::unique_ptr<ChildProcess> startFbfctl(const std::vector<std::string>& args, const fs::path& out);
  // fbf-sessiongen into the cache directory.
  RunResult generate(int sessions, int custom, int seed, const std::string& sizeMix = "small");

  // Deletion events from the analytics log, as their payloads.
  std::vector<nlohmann::json> deletionEvents() const;
  // Regular files directly in the cache directory whose names start with "session.".
  std::vector<std::string> sessionFiles() const;
  // Regular files under CustomFeedback, as "<type>/<name>".
  std::vector<std::string> customFiles() const;

  const std::map<std::string, std::string>& environment() const { return env_; }

 private:
  TempDir home_;
  XdgDirectories dirs_;
  std::map<std::string, std::string> env_;
  std::unique_ptr<ChildProcess> daemon_;
};

// Deletion reasons the cases look for; 12 is a delivered file, not a loss.
enum DeletionReason { kTooOld = 1, kTooLarge = 2, kEmpty = 3, kPruned = 4, kUploaded = 12 };
// Deletion events of files dropped without being delivered, by reason.
std::map<int, int> lossesByReason(const std::vector<nlohmann::json>& events);
int lossCount(const std::vector<nlohmann::json>& events);
// Receiver records of requests answered with 200.
size_t delivered(const std::vector<nlohmann::json>& records);
std::string tail(const std::string& text, size_t n = 4000);
// One JSON value per line of `file`; lines that do not parse are skipped.
std::vector<nlohmann::json> jsonLines(const fs::path& file);

// A home configured for a running receiver; each case writes its files and
// starts the daemon.
class ReceiverTest : public ::testing::Test {
 protected:
  void SetUp() override;
  // Replaces the receiver by one on the same port with `faults`.
  void restartReceiver(std::vector<std::string> faults = {});
  // `fbfctl flush`, which must succeed.
  void flush(std::chrono::seconds timeout = std::chrono::seconds(120));

  DaemonHome home;
  std::unique_ptr<Receiver> receiver;
};

}  // namespace fbf::testing
