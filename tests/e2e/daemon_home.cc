#include "e2e/daemon_home.h"

#include <signal.h>

#include <algorithm>
#include <fstream>

namespace fbf::testing {

using namespace std::chrono_literals;

const LoopbackCertificate& LoopbackCertificate::get() {
  static LoopbackCertificate c = [] {
    static TempDir dir;
    LoopbackCertificate out;
    out.cert = dir.path() / "cert.pem";
    out.key = dir.path() / "key.pem";
    std::string cmd = "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 30"
                      " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout '" +
                      out.key.string() + "' -out '" + out.cert.string() + "' >/dev/null 2>&1";
    out.made = std::system(cmd.c_str()) == 0 && fs::exists(out.cert) && fs::exists(out.key);
    return out;
  }();
  return c;
}

Receiver::Receiver(const fs::path& dir, int port, std::vector<std::string> extra) : recordFile_(dir / "record.jsonl") {
  const auto& cert = LoopbackCertificate::get();
  auto portFile = dir / ("port." + std::to_string(port));
  std::error_code ec;
  fs::remove(portFile, ec);
  std::vector<std::string> args = {"--listen", "127.0.0.1:" + std::to_string(port), "--tls", cert.cert.string(),
                                   cert.key.string(), "--record", recordFile_.string(), "--port-file", portFile.string()};
  args.insert(args.end(), extra.begin(), extra.end());
  process_ = std::make_unique<ChildProcess>(binDir() / "fbf-ingest", args, std::map<std::string, std::string>{},
                                            dir / "ingest.out", dir / "ingest.err");
  waitUntil(
      [&] {
        std::ifstream in(portFile);
        return static_cast<bool>(in >> port_);
      },
      10s);
}

std::vector<nlohmann::json> Receiver::records() const { return jsonLines(recordFile_); }

void Receiver::stop() {
  if (!process_) return;
  process_->signal(SIGTERM);
  process_->waitFor(10s);
  process_.reset();
}

DaemonHome::DaemonHome() : dirs_(XdgDirectories::underRoot(home_.path())), env_(xdgEnvironment(home_.path())) {}

DaemonHome::~DaemonHome() { stopDaemon(); }

void DaemonHome::writeBag(const std::string& url, const nlohmann::json& extra) {
  nlohmann::json bag = {{"feedback_url", url},
                        {"crowdsourcing_url", url},
                        {"feedback_max_age_in_days", 7},
                        {"vireon_feedback_format", "FeedbackV2PB"}};
  for (auto it = extra.begin(); it != extra.end(); ++it) bag[it.key()] = it.value();
  writeFile(cacheDir() / "bag.plist", serializePropertyList(bag, PropertyListFormat::xml));
}

void DaemonHome::configure(const std::string& url, const nlohmann::json& extra) {
  writeBag(url, extra);
  fbfctl({"defaults", "write", "vireond", "VIRUploadCAFile", "-string", LoopbackCertificate::get().cert.string()});
  fbfctl({"defaults", "write", "vireond", "FBFNoExit", "-bool", "true"});
  fbfctl({"defaults", "write", "vireond", "FlushFrequencyInSeconds", "-int", "100000000"});
  fbfctl({"defaults", "write", "vireon.privacy", "DiagnosticsAndUsageEnabled", "-bool", "true"});
  auto now = std::chrono::duration_cast<std::chrono::seconds>(std::chrono::system_clock::now().time_since_epoch());
  writeFile(cacheDir() / "fbf-last-flush", std::to_string(now.count()) + "\n");
}

std::vector<std::string> DaemonHome::descriptorLimit(int limit) {
  return {"/bin/sh", "-c", "ulimit -n " + std::to_string(limit) + " && exec \"$0\""};
}

void DaemonHome::startDaemon(const std::vector<std::string>& wrapper) {
  fs::path program = binDir() / "vireon-fbf";
  // A killed daemon leaves its socket behind: readiness is this run's socket
  // (and the "setup" line of this run's log, which starts empty).
  std::error_code ec;
  fs::remove(dirs_.socketPath(), ec);
  std::vector<std::string> args;
  if (!wrapper.empty()) {
    args.assign(wrapper.begin() + 1, wrapper.end());
    args.push_back(program.string());
    program = wrapper.front();
  }
  daemon_ = std::make_unique<ChildProcess>(program, args, env_, root() / "daemon.out", root() / "daemon.log");
  auto socket = dirs_.socketPath();
  waitUntil([&] { return fs::exists(socket) && daemonLog().find("setup") != std::string::npos; }, 10s);
}

std::optional<int> DaemonHome::stopDaemon() {
  if (!daemon_) return std::nullopt;
  daemon_->signal(SIGTERM);
  auto status = daemon_->waitFor(30s);
  daemon_.reset();
  return status;
}

std::string DaemonHome::daemonLog() const { return readFile(root() / "daemon.log"); }

RunResult DaemonHome::fbfctl(const std::vector<std::string>& args, std::chrono::milliseconds timeout) {
  return runProgram(binDir() / "fbfctl", args, env_, timeout);
}

std::unique_ptr<ChildProcess> DaemonHome::startFbfctl(const std::vector<std::string>& args, const fs::path& out) {
  return std::make_unique<ChildProcess>(binDir() / "fbfctl", args, env_, out, fs::path(out.string() + ".err"));
}

RunResult DaemonHome::generate(int sessions, int custom, int seed, const std::string& sizeMix) {
  return runProgram(binDir() / "fbf-sessiongen",
                    {"--out", cacheDir().string(), "--sessions", std::to_string(sessions), "--custom",
                     std::to_string(custom), "--seed", std::to_string(seed), "--size-mix", sizeMix},
                    env_);
}

std::vector<nlohmann::json> DaemonHome::deletionEvents() const {
  std::vector<nlohmann::json> out;
  for (auto& j : jsonLines(dirs_.stateHome / "vireon-fbf" / "analytics.jsonl")) {
    if (j.contains("payload") && j["payload"].contains("reason")) out.push_back(j["payload"]);
  }
  return out;
}

std::vector<std::string> DaemonHome::sessionFiles() const {
  std::vector<std::string> out;
  std::error_code ec;
  for (const auto& e : fs::directory_iterator(cacheDir(), ec)) {
    auto name = e.path().filename().string();
    if (e.is_regular_file() && name.starts_with("session.")) out.push_back(name);
  }
  return out;
}

std::vector<std::string> DaemonHome::customFiles() const {
  std::vector<std::string> out;
  std::error_code ec;
  for (const auto& e : fs::recursive_directory_iterator(customDir(), ec)) {
    if (e.is_regular_file()) out.push_back(e.path().lexically_relative(customDir()).string());
  }
  return out;
}

std::map<int, int> lossesByReason(const std::vector<nlohmann::json>& events) {
  std::map<int, int> out;
  for (const auto& e : events) {
    if (e.at("reason").get<int>() != kUploaded) ++out[e.at("reason").get<int>()];
  }
  return out;
}

int lossCount(const std::vector<nlohmann::json>& events) {
  auto isLoss = [](const nlohmann::json& e) { return e.at("reason").get<int>() != kUploaded; };
  return static_cast<int>(std::ranges::count_if(events, isLoss));
}

size_t delivered(const std::vector<nlohmann::json>& records) {
  return std::ranges::count_if(records,
                               [](const nlohmann::json& r) { return r.value("status", 0) == 200; });
}

std::vector<nlohmann::json> jsonLines(const fs::path& file) {
  std::vector<nlohmann::json> out;
  std::ifstream in(file);
  for (std::string line; std::getline(in, line);) {
    auto j = nlohmann::json::parse(line, nullptr, false);
    if (!j.is_discarded()) out.push_back(std::move(j));
  }
  return out;
}

std::string tail(const std::string& text, size_t n) { return text.size() > n ? text.substr(text.size() - n) : text; }

void ReceiverTest::SetUp() {
  ASSERT_TRUE(LoopbackCertificate::get().made) << "openssl could not make a certificate";
  receiver = std::make_unique<Receiver>(home.root());
  ASSERT_TRUE(receiver->running());
  home.configure(receiver->url());
}

void ReceiverTest::restartReceiver(std::vector<std::string> faults) {
  const int port = receiver->port();
  receiver->stop();
  receiver = std::make_unique<Receiver>(home.root(), port, std::move(faults));
  ASSERT_TRUE(receiver->running());
}

void ReceiverTest::flush(std::chrono::seconds timeout) {
  auto r = home.fbfctl({"flush"}, timeout);
  ASSERT_EQ(r.status, 0) << r.err << tail(home.daemonLog());
}

}  // namespace fbf::testing
