// bench-flush-throughput [--bin DIR] [--sizes N,N,...] [--latency-files N] [--keep]
//
// Whole flushes through the real programs, measured in one run:
//
//   * sessions from fbf-sessiongen (realistic size mix), copied into the
//     daemon's cache directory for each flush;
//   * receivers: nginx from Debian with the echo module (installed on demand
//     by scripts/bench.sh), one TLS port offering HTTP/2 and one HTTP/1.1
//     only, each with a location that answers at once and one that answers
//     after 50 ms (echo_sleep); and fbf-ingest beside them. The certificate
//     is a throw-away self-signed one, trusted through VIRUploadCAFile;
//   * for each flush the daemon is started afresh, timed through one
//     `fbfctl flush`, and stopped: its CPU time comes from wait4(), its peak
//     resident size (VmHWM) and open descriptors from /proc;
//   * the floor: the encoding procedure alone (serialise the session, raw
//     DEFLATE level 5 through the 4096-byte staging buffer, SHA-512 fed once
//     per pass) over the same payloads, in this process;
//   * the per-file shell loop `gzip -5 | curl` over a sample of the files;
//   * launch-to-socket-ready time and CPU used while idle.
//
// Nothing is asserted; the figures are printed.
#include "upload/compressed_output_stream.h"
#include "support/bench_support.h"

#include "corevireon.pb.h"
#include "platform/property_list.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

extern char** environ;

namespace {

using fbf::bench::NullStream;

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

fs::path gBin = FBF_DEFAULT_BIN_DIR;
std::vector<std::string> gEnv;
// The receivers, stopped on the way out whatever happens.
std::vector<pid_t> gReceivers;

void stopReceivers() {
  for (pid_t pid : gReceivers) {
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
  }
  gReceivers.clear();
}

[[noreturn]] void die(const std::string& why) {
  std::fprintf(stderr, "bench-flush-throughput: %s\n", why.c_str());
  stopReceivers();
  std::exit(1);
}

pid_t spawn(const std::vector<std::string>& args, const fs::path& out, const fs::path& err) {
  posix_spawn_file_actions_t fa;
  posix_spawn_file_actions_init(&fa);
  posix_spawn_file_actions_addopen(&fa, 1, out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  posix_spawn_file_actions_addopen(&fa, 2, err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  std::vector<char*> argv, envp;
  for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  for (const auto& e : gEnv) envp.push_back(const_cast<char*>(e.c_str()));
  envp.push_back(nullptr);
  pid_t pid = -1;
  int rc = posix_spawnp(&pid, argv[0], &fa, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&fa);
  if (rc != 0) die("cannot start " + args[0]);
  return pid;
}

int runToEnd(const std::vector<std::string>& args, const fs::path& logDir) {
  pid_t pid = spawn(args, logDir / "run.out", logDir / "run.err");
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

bool waitFor(const std::function<bool()>& pred, std::chrono::seconds limit) {
  auto end = Clock::now() + limit;
  while (Clock::now() < end) {
    if (pred()) return true;
    std::this_thread::sleep_for(20ms);
  }
  return pred();
}

std::string slurp(const fs::path& p) {
  std::ifstream in(p, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

double seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

double cpuSeconds(const rusage& u) {
  return static_cast<double>(u.ru_utime.tv_sec + u.ru_stime.tv_sec) +
         static_cast<double>(u.ru_utime.tv_usec + u.ru_stime.tv_usec) / 1e6;
}

// User plus system CPU seconds from a /proc stat file (a process's or a
// thread's).
double statCpu(const fs::path& statFile) {
  std::string field;
  // The command name may hold spaces: count fields after its closing ")".
  std::string all = slurp(statFile);
  auto close = all.rfind(')');
  if (close == std::string::npos) return 0;
  std::istringstream rest(all.substr(close + 2));
  double ticks = 0;
  for (int i = 3; i <= 15 && rest >> field; ++i) {
    if (i == 14 || i == 15) ticks += std::stod(field);
  }
  return ticks / static_cast<double>(sysconf(_SC_CLK_TCK));
}

// User plus system CPU seconds of a running process.
double processCpu(pid_t pid) { return statCpu("/proc/" + std::to_string(pid) + "/stat"); }

// CPU seconds by thread name of a running process ("name 1.23 s, ..."),
// the busiest first: which stage of the pipeline is the bottleneck.
std::string threadCpu(pid_t pid) {
  std::map<std::string, double> byName;
  std::error_code ec;
  for (fs::directory_iterator it("/proc/" + std::to_string(pid) + "/task", ec), end; !ec && it != end; it.increment(ec)) {
    std::string comm = slurp(it->path() / "comm");
    while (!comm.empty() && comm.back() == '\n') comm.pop_back();
    byName[comm] += statCpu(it->path() / "stat");
  }
  std::vector<std::pair<double, std::string>> sorted;
  for (const auto& [name, cpu] : byName) sorted.emplace_back(cpu, name);
  std::sort(sorted.rbegin(), sorted.rend());
  std::string out;
  char buffer[96];
  for (const auto& [cpu, name] : sorted) {
    std::snprintf(buffer, sizeof buffer, "%s%s %.2f s", out.empty() ? "" : ", ", name.c_str(), cpu);
    out += buffer;
  }
  return out;
}

size_t openDescriptors(pid_t pid) {
  std::error_code ec;
  size_t n = 0;
  for (fs::directory_iterator it("/proc/" + std::to_string(pid) + "/fd", ec), end; !ec && it != end; it.increment(ec)) {
    ++n;
  }
  return n;
}

// The peak resident size of a running process (VmHWM), in MB. Not wait4's
// ru_maxrss: after posix_spawn that also counts the spawning process, whose
// memory the child shared until its exec.
double peakRssMB(pid_t pid) {
  std::istringstream in(slurp("/proc/" + std::to_string(pid) + "/status"));
  for (std::string line; std::getline(in, line);) {
    if (line.starts_with("VmHWM:")) return std::stod(line.substr(6)) / 1024.0;
  }
  return 0;
}

bool socketAccepts(const fs::path& socketPath) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", socketPath.c_str());
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  close(fd);
  return ok;
}

// The encoding procedure alone, for one payload: serialise the session, and
// write it in one piece through the compressing, digesting stream (raw
// DEFLATE level 5, 4096-byte staging buffer, SHA-512 fed once per pass).
size_t encode(const corevireon::CVClientSession& session) {
  std::string bytes = session.SerializeAsString();
  auto sink = std::make_shared<NullStream>();
  fbf::CompressedOutputStream stream(sink);
  stream.open();
  stream.write(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
  stream.close();
  return sink->bytes;
}

struct Receiver {
  std::string name;
  std::string url;
};

struct FlushResult {
  size_t files = 0;
  size_t uploaded = 0;  // files gone from the cache directory
  double wall = 0;
  double cpu = 0;
  double maxRssMB = 0;
  size_t maxDescriptors = 0;
  double readySeconds = 0;
  double idleCpu = -1;  // over kIdleSeconds, when measured
  std::string threads;  // CPU by thread, at the end of the flush
  double filesPerSecond() const { return wall > 0 ? static_cast<double>(uploaded) / wall : 0; }
  double cpuPerFileMs() const { return uploaded > 0 ? cpu / static_cast<double>(uploaded) * 1e3 : 0; }
};

constexpr double kIdleSeconds = 3.0;

class Bench {
 public:
  Bench(fs::path root, std::vector<fs::path> pool) : root_(std::move(root)), pool_(std::move(pool)) {}

  fs::path cacheDir() const { return root_ / "cache" / "vireond"; }

  void writeBag(const std::string& url) {
    nlohmann::json bag = {{"feedback_url", url}, {"crowdsourcing_url", url}, {"feedback_max_age_in_days", 7},
                          {"vireon_feedback_format", "FeedbackV2PB"}};
    std::ofstream out(cacheDir() / "bag.plist", std::ios::binary | std::ios::trunc);
    out << fbf::serializePropertyList(bag, fbf::PropertyListFormat::xml);
  }

  void fill(size_t count, bool cohorts) {
    for (const auto& e : fs::directory_iterator(cacheDir())) {
      if (e.path().filename().string().starts_with("session.")) fs::remove(e.path());
    }
    std::error_code ec;
    fs::remove_all(cacheDir() / "Cohorts", ec);
    if (cohorts) {
      fs::create_directory(cacheDir() / "Cohorts");
      fs::permissions(cacheDir() / "Cohorts", fs::perms::owner_all);
    }
    for (size_t i = 0; i < count && i < pool_.size(); ++i) {
      fs::copy_file(pool_[i], cacheDir() / pool_[i].filename());
    }
  }

  size_t sessionsLeft() const {
    size_t left = 0;
    for (const auto& e : fs::directory_iterator(cacheDir())) left += e.path().filename().string().starts_with("session.");
    return left;
  }

  // Starts the daemon and waits until its socket accepts; `ready` is the
  // time that took.
  pid_t startDaemon(double& ready) {
    const fs::path socketPath = root_ / "run" / "vireon-fbf.sock";
    fs::remove(socketPath);
    auto launched = Clock::now();
    pid_t daemon = spawn({(gBin / "vireon-fbf").string()}, root_ / "daemon.out", root_ / "daemon.log");
    while (!socketAccepts(socketPath)) {
      if (Clock::now() - launched > 10s) die("the daemon did not start: " + slurp(root_ / "daemon.log"));
      std::this_thread::sleep_for(200us);
    }
    ready = seconds(Clock::now() - launched);
    return daemon;
  }

  // Launch to a socket that accepts, with an empty cache, then SIGTERM.
  double launch() {
    fill(0, false);
    double ready = 0;
    pid_t daemon = startDaemon(ready);
    kill(daemon, SIGTERM);
    waitpid(daemon, nullptr, 0);
    return ready;
  }

  FlushResult flush(const Receiver& receiver, size_t count, bool cohorts = false, bool measureIdle = false) {
    writeBag(receiver.url);
    fill(count, cohorts);
    FlushResult r;
    r.files = count;
    pid_t daemon = startDaemon(r.readySeconds);
    if (measureIdle) {
      std::this_thread::sleep_for(500ms);  // past bring-up
      double before = processCpu(daemon);
      std::this_thread::sleep_for(std::chrono::duration<double>(kIdleSeconds));
      r.idleCpu = processCpu(daemon) - before;
    }

    std::atomic<bool> running{true};
    std::atomic<size_t> maxFds{0};
    std::thread sampler([&] {
      while (running) {
        maxFds = std::max(maxFds.load(), openDescriptors(daemon));
        std::this_thread::sleep_for(5ms);
      }
    });
    auto t0 = Clock::now();
    int status = runToEnd({(gBin / "fbfctl").string(), "flush"}, root_);
    r.wall = seconds(Clock::now() - t0);
    running = false;
    sampler.join();
    if (status != 0) die("fbfctl flush failed: " + slurp(root_ / "run.err"));
    r.maxDescriptors = maxFds;
    r.maxRssMB = peakRssMB(daemon);
    r.threads = threadCpu(daemon);

    kill(daemon, SIGTERM);
    rusage usage{};
    int waitStatus = 0;
    wait4(daemon, &waitStatus, 0, &usage);
    r.cpu = cpuSeconds(usage);
    r.uploaded = count - std::min(count, sessionsLeft());
    return r;
  }

 private:
  fs::path root_;
  std::vector<fs::path> pool_;
};

std::string nginxConfig(const fs::path& dir, int h2Port, int h1Port) {
  std::string d = dir.string();
  std::string locations =
      "    location /lat0/ { echo_read_request_body; echo ok; }\n"
      "    location /lat50/ { echo_read_request_body; echo_sleep 0.05; echo ok; }\n";
  return "load_module /usr/lib/nginx/modules/ngx_http_echo_module.so;\n"
         "daemon off;\nmaster_process off;\nworker_processes 1;\nuser root;\n"
         "pid " + d + "/nginx.pid;\nerror_log " + d + "/error.log warn;\n"
         "events { worker_connections 4096; }\n"
         "http {\n  access_log off;\n"
         "  client_body_temp_path " + d + "/body;\n  proxy_temp_path " + d + "/proxy;\n"
         "  fastcgi_temp_path " + d + "/fastcgi;\n  uwsgi_temp_path " + d + "/uwsgi;\n  scgi_temp_path " + d + "/scgi;\n"
         "  client_max_body_size 64m;\n  client_body_buffer_size 1m;\n  keepalive_requests 1000000;\n"
         "  ssl_certificate " + d + "/cert.pem;\n  ssl_certificate_key " + d + "/key.pem;\n"
         "  server {\n    listen 127.0.0.1:" + std::to_string(h2Port) + " ssl http2;\n" + locations + "  }\n"
         "  server {\n    listen 127.0.0.1:" + std::to_string(h1Port) + " ssl;\n" + locations + "  }\n}\n";
}

int freePort() {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  socklen_t len = sizeof addr;
  getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
  close(fd);
  return ntohs(addr.sin_port);
}

std::vector<size_t> parseSizes(const std::string& text) {
  std::vector<size_t> out;
  std::stringstream in(text);
  for (std::string item; std::getline(in, item, ',');) {
    long n = std::atol(item.c_str());
    if (n < 1) die("--sizes needs positive numbers");
    out.push_back(static_cast<size_t>(n));
  }
  return out;
}

void printFlush(const char* label, const FlushResult& r, double floorMs) {
  std::printf("  %-34s %5zu files, %5zu uploaded, %6.2f s, %7.1f files/s, %6.3f ms CPU/file (%.2f x floor), "
              "%6.1f MB peak RSS, %3zu fds max\n",
              label, r.files, r.uploaded, r.wall, r.filesPerSecond(), r.cpuPerFileMs(),
              floorMs > 0 ? r.cpuPerFileMs() / floorMs : 0.0, r.maxRssMB, r.maxDescriptors);
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<size_t> sizes = {400, 1000, 2000, 8000};
  size_t latencyFiles = 400;
  bool keep = false;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--sizes" && i + 1 < argc) {
      sizes = parseSizes(argv[++i]);
    } else if (a == "--latency-files" && i + 1 < argc) {
      latencyFiles = static_cast<size_t>(std::max(1, std::atoi(argv[++i])));
    } else if (a == "--bin" && i + 1 < argc) {
      gBin = argv[++i];
    } else if (a == "--keep") {
      keep = true;
    } else {
      std::fprintf(stderr, "usage: bench-flush-throughput [--bin DIR] [--sizes N,N,...] [--latency-files N] [--keep]\n");
      return 2;
    }
  }
  std::sort(sizes.begin(), sizes.end());
  if (!fs::exists("/usr/lib/nginx/modules/ngx_http_echo_module.so") ||
      std::system("command -v nginx >/dev/null 2>&1") != 0) {
    die("nginx and its echo module are needed (apt-get install nginx libnginx-mod-http-echo; scripts/bench.sh does)");
  }

  char tmpl[] = "/tmp/fbf-bench-flush-XXXXXX";
  if (!mkdtemp(tmpl)) die("mkdtemp failed");
  const fs::path root = tmpl;
  const fs::path cache = root / "cache", cacheDir = cache / "vireond", run = root / "run", pool = root / "pool",
                 web = root / "nginx";
  for (const auto& d : {cacheDir, root / "config", root / "state", root / "data", root / "share", run, pool, web}) {
    fs::create_directories(d);
    fs::permissions(d, fs::perms::owner_all);
  }
  const char* path = std::getenv("PATH");
  gEnv = {"HOME=" + root.string(),
          "XDG_CACHE_HOME=" + cache.string(),
          "XDG_CONFIG_HOME=" + (root / "config").string(),
          "XDG_STATE_HOME=" + (root / "state").string(),
          "XDG_DATA_HOME=" + (root / "data").string(),
          "XDG_DATA_DIRS=" + (root / "share").string(),
          "XDG_RUNTIME_DIR=" + run.string(),
          "VIREON_FBF_LOG_LEVEL=warn",
          std::string("PATH=") + (path ? path : "/usr/bin:/bin")};

  // A throw-away certificate for both receivers.
  const auto cert = web / "cert.pem", key = web / "key.pem";
  std::string cmd = "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2"
                    " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout '" +
                    key.string() + "' -out '" + cert.string() + "' >/dev/null 2>&1";
  if (std::system(cmd.c_str()) != 0) die("openssl could not make a certificate");

  // nginx: an HTTP/2 port and an HTTP/1.1-only port.
  const int h2Port = freePort(), h1Port = freePort();
  std::ofstream(web / "nginx.conf") << nginxConfig(web, h2Port, h1Port);
  gReceivers.push_back(spawn({"nginx", "-c", (web / "nginx.conf").string(), "-p", web.string()}, web / "nginx.out",
                      web / "nginx.err"));
  // fbf-ingest beside it.
  const auto portFile = root / "ingest.port", records = root / "uploads.jsonl";
  gReceivers.push_back(spawn({(gBin / "fbf-ingest").string(), "--listen", "127.0.0.1:0", "--tls", cert.string(), key.string(),
                        "--record", records.string(), "--port-file", portFile.string()},
                       root / "ingest.out", root / "ingest.err"));
  int ingestPort = 0;
  if (!waitFor([&] { return static_cast<bool>(std::ifstream(portFile) >> ingestPort); }, 10s)) {
    die("fbf-ingest did not start");
  }
  auto https = [](int port, const char* path) { return "https://127.0.0.1:" + std::to_string(port) + path; };
  const Receiver h2{"nginx HTTP/2", https(h2Port, "/lat0/feedback")};
  const Receiver h2Slow{"nginx HTTP/2, 50 ms", https(h2Port, "/lat50/feedback")};
  const Receiver h1{"nginx HTTP/1.1", https(h1Port, "/lat0/feedback")};
  const Receiver h1Slow{"nginx HTTP/1.1, 50 ms", https(h1Port, "/lat50/feedback")};
  const Receiver ingestReceiver{"fbf-ingest", https(ingestPort, "/feedback")};
  if (!waitFor([&] { return fs::exists(web / "nginx.pid"); }, 10s)) die("nginx did not start: " + slurp(web / "nginx.err"));

  // Preferences: the CA, consent, and no periodic run or exit of its own.
  const std::string fbfctl = (gBin / "fbfctl").string();
  for (const auto& args : std::vector<std::vector<std::string>>{
           {fbfctl, "defaults", "write", "vireond", "VIRUploadCAFile", "-string", cert.string()},
           {fbfctl, "defaults", "write", "vireond", "FBFNoExit", "-bool", "true"},
           {fbfctl, "defaults", "write", "vireond", "FlushFrequencyInSeconds", "-int", "100000000"},
           {fbfctl, "defaults", "write", "vireon.privacy", "DiagnosticsAndUsageEnabled", "-bool", "true"}}) {
    if (runToEnd(args, root) != 0) die("fbfctl defaults write failed: " + slurp(root / "run.err"));
  }
  {
    std::ofstream out(cacheDir / "fbf-last-flush");
    out << std::chrono::duration_cast<std::chrono::seconds>(std::chrono::system_clock::now().time_since_epoch()).count()
        << "\n";
  }

  // The sessions, once, into a pool copied from for every flush.
  const size_t poolSize = std::max(sizes.back(), latencyFiles);
  if (runToEnd({(gBin / "fbf-sessiongen").string(), "--out", pool.string(), "--sessions", std::to_string(poolSize),
                "--seed", "1", "--size-mix", "realistic"},
               root) != 0) {
    die("fbf-sessiongen failed: " + slurp(root / "run.err"));
  }
  std::vector<fs::path> sessions;
  for (const auto& e : fs::directory_iterator(pool)) {
    if (e.path().filename().string().starts_with("session.")) sessions.push_back(e.path());
  }
  std::sort(sessions.begin(), sessions.end());

  // The floor over the payloads of the largest size that is measured with
  // CPU per file (2,000 files, or the largest below).
  size_t floorFiles = sizes.front();
  for (size_t s : sizes) {
    if (s <= 2000) floorFiles = s;
  }
  std::vector<corevireon::CVClientSession> parsed;
  uint64_t payloadBytes = 0;
  for (size_t i = 0; i < floorFiles && i < sessions.size(); ++i) {
    std::string bytes = slurp(sessions[i]);
    payloadBytes += bytes.size();
    parsed.emplace_back();
    if (!parsed.back().ParseFromString(bytes)) die("a generated session does not parse: " + sessions[i].string());
  }
  // Timed three times over the run (first, after the backlog sizes, last),
  // since the machine may be shared; the median is the floor.
  size_t sink = 0;
  auto timeFloor = [&] {
    rusage before{}, after{};
    getrusage(RUSAGE_THREAD, &before);
    for (const auto& s : parsed) sink += encode(s);
    getrusage(RUSAGE_THREAD, &after);
    return (cpuSeconds(after) - cpuSeconds(before)) / static_cast<double>(parsed.size()) * 1e3;
  };
  std::vector<double> floors = {timeFloor()};
  double floorMs = floors[0];
  Bench bench(root, sessions);
  std::printf("Flush benchmark: sessions from fbf-sessiongen (realistic mix), HTTPS on loopback, %u cores\n",
              std::thread::hardware_concurrency());
  std::printf("floor (serialise + raw DEFLATE 5 + SHA-512 per pass): %.3f ms CPU per file over %zu files "
              "(%.1f MB, %zu B out)\n",
              floorMs, parsed.size(), payloadBytes / 1e6, sink);

  // Sizes: CPU per file, throughput, peak RSS, descriptors.
  std::printf("nginx HTTP/2, no latency, by backlog size:\n");
  std::map<size_t, FlushResult> bySize;
  for (size_t n : sizes) {
    bySize[n] = bench.flush(h2, n, false, n == sizes.front());
    printFlush(h2.name.c_str(), bySize[n], floorMs);
  }
  floors.push_back(timeFloor());
  const FlushResult& main = bySize.count(floorFiles) ? bySize[floorFiles] : bySize.begin()->second;

  // Latency and protocol.
  std::printf("server latency (%zu files):\n", latencyFiles);
  FlushResult h2Fast = bySize.count(latencyFiles) ? bySize[latencyFiles] : bench.flush(h2, latencyFiles);
  if (!bySize.count(latencyFiles)) printFlush(h2.name.c_str(), h2Fast, floorMs);
  FlushResult h2Late = bench.flush(h2Slow, latencyFiles);
  printFlush(h2Slow.name.c_str(), h2Late, floorMs);
  FlushResult h1Fast = bench.flush(h1, latencyFiles);
  printFlush(h1.name.c_str(), h1Fast, floorMs);
  FlushResult h1Late = bench.flush(h1Slow, latencyFiles);
  printFlush(h1Slow.name.c_str(), h1Late, floorMs);

  // The other receiver and the cohorts store.
  std::printf("other runs (%zu files):\n", floorFiles);
  FlushResult viaIngest = bench.flush(ingestReceiver, floorFiles);
  printFlush(ingestReceiver.name.c_str(), viaIngest, floorMs);
  // The store's cost is about one per cent of the instructions, well inside
  // the drift between runs on a shared machine: five pairs of runs, in the
  // order absent-present, present-absent, ... so that a steady drift cancels,
  // and the median of the pairs' ratios is the figure.
  constexpr int kCohortPairs = 5;
  std::vector<double> cpuAbsent, cpuPresent, cohortRatios;
  FlushResult withCohorts;
  for (int i = 0; i < kCohortPairs; ++i) {
    FlushResult absent, present;
    for (bool cohorts : {i % 2 == 1, i % 2 == 0}) {
      FlushResult r = bench.flush(h2, floorFiles, cohorts);
      printFlush(cohorts ? "nginx HTTP/2, cohorts store present" : "nginx HTTP/2, cohorts store absent", r, floorMs);
      (cohorts ? present : absent) = r;
    }
    withCohorts = present;
    cpuAbsent.push_back(absent.cpuPerFileMs());
    cpuPresent.push_back(present.cpuPerFileMs());
    cohortRatios.push_back(present.cpuPerFileMs() / std::max(absent.cpuPerFileMs(), 1e-9));
  }
  std::sort(cpuAbsent.begin(), cpuAbsent.end());
  std::sort(cpuPresent.begin(), cpuPresent.end());
  std::sort(cohortRatios.begin(), cohortRatios.end());

  // The shell loop, over a sample, against the HTTP/1.1 port.
  const size_t loopFiles = std::min<size_t>(100, sessions.size());
  std::string loop = "for f in";
  for (size_t i = 0; i < loopFiles; ++i) loop += " '" + sessions[i].string() + "'";
  loop += "; do gzip -5 -c \"$f\" | curl -s -o /dev/null --cacert '" + cert.string() +
          "' -H 'Content-Encoding: gzip' --data-binary @- '" + h1.url + "' || exit 1; done";
  auto l0 = Clock::now();
  int loopStatus = std::system(loop.c_str());
  double loopWall = seconds(Clock::now() - l0);
  const double loopRate = loopStatus == 0 ? static_cast<double>(loopFiles) / loopWall : 0;

  // The ratios, against the median floor.
  floors.push_back(timeFloor());
  std::sort(floors.begin(), floors.end());
  floorMs = floors[1];
  std::printf("floor timings: %.3f, %.3f, %.3f ms per file; median %.3f (the per-run ratios above used the first)\n",
              floors[0], floors[1], floors[2], floorMs);
  const FlushResult& first = bySize.begin()->second;
  const FlushResult& last = bySize.rbegin()->second;
  std::printf("summary:\n");
  std::printf("  CPU per file / floor                      %.2f (%.3f ms / %.3f ms, %zu files)\n",
              main.cpuPerFileMs() / floorMs, main.cpuPerFileMs(), floorMs, main.files);
  std::printf("  files/s x floor per file                  %.2f (%.1f files/s x %.3f ms)\n",
              main.filesPerSecond() * floorMs / 1e3, main.filesPerSecond(), floorMs);
  std::printf("  HTTP/2: 50 ms latency / none              %.2f (%.1f / %.1f files/s)\n",
              h2Late.filesPerSecond() / std::max(h2Fast.filesPerSecond(), 1e-9), h2Late.filesPerSecond(),
              h2Fast.filesPerSecond());
  std::printf("  HTTP/1.1: 50 ms latency / none            %.2f (%.1f / %.1f files/s); uploads in flight %.1f\n",
              h1Late.filesPerSecond() / std::max(h1Fast.filesPerSecond(), 1e-9), h1Late.filesPerSecond(),
              h1Fast.filesPerSecond(), h1Late.filesPerSecond() * 0.05);
  std::printf("  peak RSS %zu -> %zu files                %.2f (%.1f -> %.1f MB)\n", first.files, last.files,
              last.maxRssMB / std::max(first.maxRssMB, 1e-9), first.maxRssMB, last.maxRssMB);
  if (bySize.count(400) && bySize.count(2000)) {
    std::printf("  peak RSS 400 -> 2000 files                %.2f\n", bySize[2000].maxRssMB / bySize[400].maxRssMB);
  }
  size_t maxFds = 0;
  for (const auto& [n, r] : bySize) maxFds = std::max(maxFds, r.maxDescriptors);
  for (const auto* r : {&h2Late, &h1Fast, &h1Late, &viaIngest, &withCohorts}) maxFds = std::max(maxFds, r->maxDescriptors);
  std::printf("  open descriptors, most seen in any run    %zu\n", maxFds);
  std::printf("  daemon / gzip|curl loop                   %.1f (%.1f / %.1f files/s, loop over %zu files)\n",
              loopRate > 0 ? main.filesPerSecond() / loopRate : 0.0, main.filesPerSecond(), loopRate, loopFiles);
  std::printf("  cohorts store present / absent, CPU/file  %.3f (median of %d paired runs, %.3f to %.3f; medians %.3f / %.3f ms)\n",
              cohortRatios[kCohortPairs / 2], kCohortPairs, cohortRatios.front(), cohortRatios.back(),
              cpuPresent[kCohortPairs / 2], cpuAbsent[kCohortPairs / 2]);
  std::printf("  fbf-ingest / nginx HTTP/2 files/s         %.2f (%.1f / %.1f)\n",
              viaIngest.filesPerSecond() / std::max(main.filesPerSecond(), 1e-9), viaIngest.filesPerSecond(),
              main.filesPerSecond());
  std::vector<double> launches;
  for (const auto& [n, r] : bySize) launches.push_back(r.readySeconds);
  for (int i = 0; i < 9; ++i) launches.push_back(bench.launch());
  std::sort(launches.begin(), launches.end());
  std::printf("  launch to socket ready                    %.1f ms median, %.1f ms best (%zu launches)\n",
              launches[launches.size() / 2] * 1e3, launches.front() * 1e3, launches.size());
  std::printf("  daemon CPU by thread (%zu files)          %s\n", main.files, main.threads.c_str());
  std::printf("  CPU while idle                            %.1f ms over %.0f s\n", first.idleCpu * 1e3, kIdleSeconds);

  stopReceivers();
  if (keep) {
    std::printf("kept %s\n", root.c_str());
  } else {
    std::error_code ec;
    fs::remove_all(root, ec);
  }
  return 0;
}
