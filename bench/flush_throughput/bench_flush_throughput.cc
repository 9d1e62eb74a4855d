// bench-flush-throughput [--sessions N] [--bin DIR] [--keep]
//
// Generates N sessions (realistic size mix) with fbf-sessiongen in a
// throw-away home, starts fbf-ingest (HTTPS, loopback) and the daemon, times
// one `fbfctl flush`, then stops the daemon and reads its CPU time and peak
// resident size from wait4(). In the same run it times plain zlib level-5
// raw DEFLATE plus SHA-512 over the same session payloads, as the floor the
// daemon's per-file cost is compared against.
#include "platform/property_list.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <signal.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zlib.h>

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

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

fs::path gBin = FBF_DEFAULT_BIN_DIR;
std::vector<std::string> gEnv;

[[noreturn]] void die(const std::string& why) {
  std::fprintf(stderr, "bench-flush-throughput: %s\n", why.c_str());
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
  int rc = posix_spawn(&pid, argv[0], &fa, nullptr, argv.data(), envp.data());
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

double cpuSeconds(const rusage& u) {
  return static_cast<double>(u.ru_utime.tv_sec + u.ru_stime.tv_sec) +
         static_cast<double>(u.ru_utime.tv_usec + u.ru_stime.tv_usec) / 1e6;
}

double processCpuSeconds() {
  rusage u{};
  getrusage(RUSAGE_SELF, &u);
  return cpuSeconds(u);
}

// zlib level 5, raw DEFLATE (window bits -15), and SHA-512 of the input, as
// the upload path needs for one payload. Returns the compressed size.
size_t deflateAndDigest(const std::string& in, std::string& buffer) {
  z_stream z{};
  if (deflateInit2(&z, 5, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) != Z_OK) die("deflateInit2 failed");
  buffer.resize(deflateBound(&z, in.size()));
  z.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(in.data()));
  z.avail_in = static_cast<uInt>(in.size());
  z.next_out = reinterpret_cast<Bytef*>(buffer.data());
  z.avail_out = static_cast<uInt>(buffer.size());
  if (deflate(&z, Z_FINISH) != Z_STREAM_END) die("deflate failed");
  size_t out = z.total_out;
  deflateEnd(&z);
  unsigned char md[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  EVP_Digest(in.data(), in.size(), md, &len, EVP_sha512(), nullptr);
  return out + len;
}

}  // namespace

int main(int argc, char** argv) {
  int sessions = 2000;
  bool keep = false;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--sessions" && i + 1 < argc) {
      sessions = std::atoi(argv[++i]);
      if (sessions < 1) die("--sessions needs a positive number");
    } else if (a == "--bin" && i + 1 < argc) {
      gBin = argv[++i];
    } else if (a == "--keep") {
      keep = true;
    } else {
      std::fprintf(stderr, "usage: bench-flush-throughput [--sessions N] [--bin DIR] [--keep]\n");
      return 2;
    }
  }

  char tmpl[] = "/tmp/fbf-bench-flush-XXXXXX";
  if (!mkdtemp(tmpl)) die("mkdtemp failed");
  const fs::path root = tmpl;
  const fs::path cache = root / "cache", cacheDir = cache / "vireond", run = root / "run";
  for (const auto& d : {cacheDir, root / "config", root / "state", root / "data", root / "share", run}) {
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

  // Certificate and receiver.
  const auto cert = root / "cert.pem", key = root / "key.pem";
  std::string cmd = "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2"
                    " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout '" +
                    key.string() + "' -out '" + cert.string() + "' >/dev/null 2>&1";
  if (std::system(cmd.c_str()) != 0) die("openssl could not make a certificate");
  const auto portFile = root / "ingest.port", records = root / "uploads.jsonl";
  pid_t ingest = spawn({(gBin / "fbf-ingest").string(), "--listen", "127.0.0.1:0", "--tls", cert.string(),
                        key.string(), "--record", records.string(), "--port-file", portFile.string()},
                       root / "ingest.out", root / "ingest.err");
  int port = 0;
  if (!waitFor([&] { return static_cast<bool>(std::ifstream(portFile) >> port); }, 10s)) die("fbf-ingest did not start");
  const std::string url = "https://127.0.0.1:" + std::to_string(port) + "/feedback";

  // Configuration: the bag, the CA, consent, and no periodic run or exit of its own.
  nlohmann::json bag = {{"feedback_url", url}, {"crowdsourcing_url", url}, {"feedback_max_age_in_days", 7},
                        {"vireon_feedback_format", "FeedbackV2PB"}};
  {
    std::ofstream out(cacheDir / "bag.plist", std::ios::binary);
    out << fbf::serializePropertyList(bag, fbf::PropertyListFormat::xml);
  }
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

  // The sessions, and their payloads for the baseline.
  if (runToEnd({(gBin / "fbf-sessiongen").string(), "--out", cacheDir.string(), "--sessions",
                std::to_string(sessions), "--seed", "1", "--size-mix", "realistic"},
               root) != 0) {
    die("fbf-sessiongen failed: " + slurp(root / "run.err"));
  }
  std::vector<std::string> payloads;
  uint64_t totalBytes = 0;
  for (const auto& e : fs::directory_iterator(cacheDir)) {
    if (e.path().filename().string().starts_with("session.")) {
      payloads.push_back(slurp(e.path()));
      totalBytes += payloads.back().size();
    }
  }

  // The daemon and one flush.
  pid_t daemon = spawn({(gBin / "vireon-fbf").string()}, root / "daemon.out", root / "daemon.log");
  if (!waitFor([&] { return fs::exists(run / "vireon-fbf.sock"); }, 10s)) die("the daemon did not start");
  std::this_thread::sleep_for(200ms);
  auto t0 = Clock::now();
  int flushStatus = runToEnd({fbfctl, "flush"}, root);
  double wall = std::chrono::duration<double>(Clock::now() - t0).count();
  if (flushStatus != 0) die("fbfctl flush failed: " + slurp(root / "run.err"));

  kill(daemon, SIGTERM);
  int status = 0;
  rusage usage{};
  wait4(daemon, &status, 0, &usage);
  kill(ingest, SIGTERM);
  waitpid(ingest, &status, 0);

  size_t uploaded = 0, digestsOk = 0;
  uint64_t sentBytes = 0;
  {
    std::ifstream in(records);
    for (std::string line; std::getline(in, line);) {
      auto r = nlohmann::json::parse(line, nullptr, false);
      if (r.is_discarded()) continue;
      uploaded += r.value("status", 0) == 200;
      digestsOk += r.value("digest_ok", false);
      sentBytes += r.value("body_size", uint64_t{0});
    }
  }
  size_t left = 0;
  for (const auto& e : fs::directory_iterator(cacheDir)) left += e.path().filename().string().starts_with("session.");

  // The baseline over the same payloads.
  std::string buffer;
  size_t sink = 0;
  double c0 = processCpuSeconds();
  auto b0 = Clock::now();
  for (const auto& p : payloads) sink += deflateAndDigest(p, buffer);
  double baseWall = std::chrono::duration<double>(Clock::now() - b0).count();
  double baseCpu = processCpuSeconds() - c0;

  const double n = static_cast<double>(payloads.size());
  const double daemonCpu = cpuSeconds(usage);
  std::printf("sessions               %zu (%.1f MB on disk, realistic size mix)\n", payloads.size(), totalBytes / 1e6);
  std::printf("uploaded               %zu, digests ok %zu, files left %zu, %.1f MB sent\n", uploaded, digestsOk, left,
              sentBytes / 1e6);
  std::printf("flush wall time        %.2f s\n", wall);
  std::printf("files per second       %.1f\n", n / wall);
  std::printf("MB per second          %.2f (session bytes read)\n", totalBytes / 1e6 / wall);
  std::printf("daemon CPU             %.2f s, %.3f ms per file\n", daemonCpu, daemonCpu / n * 1e3);
  std::printf("daemon peak memory     %.1f MB (max RSS)\n", usage.ru_maxrss / 1024.0);
  std::printf("zlib-5 raw + SHA-512   %.2f s CPU (%.2f s wall), %.3f ms per file [%zu]\n", baseCpu, baseWall,
              baseCpu / n * 1e3, sink % 10);
  std::printf("ratio daemon/baseline  %.2f (CPU per file)\n", baseCpu > 0 ? daemonCpu / baseCpu : 0.0);

  if (keep) {
    std::printf("kept %s\n", root.c_str());
  } else {
    std::error_code ec;
    fs::remove_all(root, ec);
  }
  return uploaded == payloads.size() ? 0 : 1;
}
