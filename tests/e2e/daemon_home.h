// A throw-away home in which the real daemon, receiver and command-line
// tools run against each other over HTTPS on loopback.
#pragma once

#include "support/process.h"
#include "support/test_support.h"

#include <nlohmann/json.hpp>

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf::testing {

// A key and self-signed certificate for 127.0.0.1, made once per run with
// the openssl command-line tool.
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

}  // namespace fbf::testing
