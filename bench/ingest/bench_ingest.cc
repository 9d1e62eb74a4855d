// bench-ingest [--seconds N] [--connections N] [--bin DIR]
//
// How many uploads per second fbf-ingest takes with its record written, so
// that it is known never to be what limits the other benchmarks. Bodies are
// made as the uploader makes them: a session from fbf-sessiongen as a
// CVClientSession, compressed in one write (so with the per-pass digest).
// Two bodies: one of about 20 KB on the wire, and one whose payload is about
// 20 KB before compression. The load comes from wrk (Debian package "wrk"),
// over plain HTTP and over TLS, keep-alive. The receiver's CPU time is read
// from /proc, and the record is counted against wrk's requests.
#include "upload/compressed_output_stream.h"

#include "corevireon.pb.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

extern char** environ;

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

fs::path gBin = FBF_DEFAULT_BIN_DIR;

[[noreturn]] void die(const std::string& why) {
  std::fprintf(stderr, "bench-ingest: %s\n", why.c_str());
  std::exit(1);
}

pid_t spawn(const std::vector<std::string>& args, const fs::path& out) {
  posix_spawn_file_actions_t fa;
  posix_spawn_file_actions_init(&fa);
  posix_spawn_file_actions_addopen(&fa, 1, out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  posix_spawn_file_actions_adddup2(&fa, 1, 2);
  std::vector<char*> argv;
  for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  pid_t pid = -1;
  int rc = posix_spawnp(&pid, argv[0], &fa, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&fa);
  if (rc != 0) die("cannot start " + args[0]);
  return pid;
}

int runToEnd(const std::vector<std::string>& args, const fs::path& out) {
  pid_t pid = spawn(args, out);
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128;
}

std::string slurp(const fs::path& p) {
  std::ifstream in(p, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

// User plus system CPU seconds of a running process.
double processCpu(pid_t pid) {
  std::istringstream in(slurp("/proc/" + std::to_string(pid) + "/stat"));
  std::string field;
  double ticks = 0;
  for (int i = 1; i <= 15 && in >> field; ++i) {
    if (i == 14 || i == 15) ticks += std::stod(field);
  }
  return ticks / static_cast<double>(sysconf(_SC_CLK_TCK));
}

struct Body {
  std::string compressed;
  std::string digest;
  size_t payload = 0;
};

Body compress(const std::string& payload) {
  auto out = std::make_shared<fbf::MemoryOutputStream>();
  fbf::CompressedOutputStream stream(out);
  stream.open();
  stream.write(reinterpret_cast<const uint8_t*>(payload.data()), payload.size());
  stream.close();
  return {out->data(), stream.dataDigestForStream(), payload.size()};
}

// The session whose compressed body (or payload) is nearest `target`.
Body pick(const std::vector<std::string>& payloads, size_t target, bool byWire) {
  Body best;
  size_t bestDistance = SIZE_MAX;
  for (const auto& p : payloads) {
    if (!byWire) {
      size_t d = p.size() > target ? p.size() - target : target - p.size();
      if (d < bestDistance) bestDistance = d, best.payload = p.size(), best.compressed = p;
      continue;
    }
    Body b = compress(p);
    size_t d = b.compressed.size() > target ? b.compressed.size() - target : target - b.compressed.size();
    if (d < bestDistance) bestDistance = d, best = b;
  }
  return byWire ? best : compress(best.compressed);
}

struct Run {
  double requestsPerSecond = 0;
  long requests = 0;
  double cpuPerRequestUs = 0;
  size_t recordLines = 0;
};

Run load(const fs::path& root, const Body& body, bool tls, int connections, int seconds) {
  const auto cert = root / "cert.pem", key = root / "key.pem", portFile = root / "port",
             record = root / "record.jsonl", bodyFile = root / "body.bin", script = root / "post.lua";
  fs::remove(portFile);
  fs::remove(record);
  std::ofstream(bodyFile, std::ios::binary) << body.compressed;
  std::ofstream(script) << "local f = io.open('" << bodyFile.string() << "', 'rb')\n"
                        << "wrk.method = 'POST'\nwrk.body = f:read('*a')\nf:close()\n"
                        << "wrk.path = '/feedback?type=FeedbackV2PB&v=2'\n"
                        << "wrk.headers['Content-Type'] = 'application/protobuf'\n"
                        << "wrk.headers['Content-Encoding'] = 'deflate'\n"
                        << "wrk.headers['X-Corvane-Digest'] = '" << body.digest << "'\n";
  std::vector<std::string> args = {(gBin / "fbf-ingest").string(), "--listen", "127.0.0.1:0", "--record",
                                   record.string(), "--port-file", portFile.string()};
  if (tls) args.insert(args.end(), {"--tls", cert.string(), key.string()});
  pid_t ingest = spawn(args, root / "ingest.log");
  int port = 0;
  for (int i = 0; i < 500 && !(std::ifstream(portFile) >> port); ++i) std::this_thread::sleep_for(10ms);
  if (port == 0) die("fbf-ingest did not start: " + slurp(root / "ingest.log"));
  std::string url = (tls ? "https://127.0.0.1:" : "http://127.0.0.1:") + std::to_string(port);
  double cpu0 = processCpu(ingest);
  int rc = runToEnd({"wrk", "-t1", "-c" + std::to_string(connections), "-d" + std::to_string(seconds) + "s", "-s",
                     script.string(), url},
                    root / "wrk.out");
  double cpu = processCpu(ingest) - cpu0;
  kill(ingest, SIGTERM);
  waitpid(ingest, nullptr, 0);
  if (rc != 0) die("wrk failed: " + slurp(root / "wrk.out"));
  std::string out = slurp(root / "wrk.out");
  Run r;
  std::smatch m;
  if (std::regex_search(out, m, std::regex(R"((\d+) requests in)"))) r.requests = std::stol(m[1]);
  if (std::regex_search(out, m, std::regex(R"(Requests/sec:\s+([\d.]+))"))) r.requestsPerSecond = std::stod(m[1]);
  if (out.find("Non-2xx") != std::string::npos || out.find("Socket errors") != std::string::npos) {
    std::fprintf(stderr, "%s", out.c_str());
  }
  std::ifstream in(record);
  size_t ok = 0;
  for (std::string line; std::getline(in, line);) {
    ++r.recordLines;
    ok += line.find("\"digest_ok\":true") != std::string::npos && line.find("\"decoded\":{") != std::string::npos;
  }
  if (ok != r.recordLines) std::fprintf(stderr, "bench-ingest: %zu of %zu lines not verified and decoded\n",
                                        r.recordLines - ok, r.recordLines);
  r.cpuPerRequestUs = r.requests > 0 ? cpu / static_cast<double>(r.requests) * 1e6 : 0;
  return r;
}

}  // namespace

int main(int argc, char** argv) {
  int seconds = 5, connections = 16;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--seconds" && i + 1 < argc) {
      seconds = std::max(1, std::atoi(argv[++i]));
    } else if (a == "--connections" && i + 1 < argc) {
      connections = std::max(1, std::atoi(argv[++i]));
    } else if (a == "--bin" && i + 1 < argc) {
      gBin = argv[++i];
    } else {
      std::fprintf(stderr, "usage: bench-ingest [--seconds N] [--connections N] [--bin DIR]\n");
      return 2;
    }
  }
  if (std::system("command -v wrk >/dev/null 2>&1") != 0) {
    std::printf("bench-ingest: wrk is not installed (apt-get install wrk); skipped\n");
    return 0;
  }
  char tmpl[] = "/tmp/fbf-bench-ingest-XXXXXX";
  if (!mkdtemp(tmpl)) die("mkdtemp failed");
  const fs::path root = tmpl;
  std::string cmd = "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 1"
                    " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout '" +
                    (root / "key.pem").string() + "' -out '" + (root / "cert.pem").string() + "' >/dev/null 2>&1";
  if (std::system(cmd.c_str()) != 0) die("openssl could not make a certificate");
  if (runToEnd({(gBin / "fbf-sessiongen").string(), "--out", (root / "sessions").string(), "--sessions", "60",
                "--seed", "7", "--size-mix", "realistic"},
               root / "gen.log") != 0) {
    die("fbf-sessiongen failed: " + slurp(root / "gen.log"));
  }
  std::vector<std::string> payloads;
  for (const auto& e : fs::directory_iterator(root / "sessions")) {
    if (!e.path().filename().string().starts_with("session.")) continue;
    corevireon::CVClientSession session;
    if (!session.ParseFromString(slurp(e.path()))) continue;
    session.set_agent("Wayfin/17.0");
    session.set_countrycode("DE");
    session.set_locale("de_DE");
    payloads.push_back(session.SerializeAsString());
  }
  if (payloads.empty()) die("no session could be read");

  std::printf("fbf-ingest under wrk, %d connections, %d s per run, record written\n", connections, seconds);
  for (bool byWire : {true, false}) {
    Body body = pick(payloads, 20 * 1024, byWire);
    for (bool tls : {false, true}) {
      Run r = load(root, body, tls, connections, seconds);
      std::printf("  %-5s body %6zu B (payload %6zu B): %8.0f requests/s, %6.1f us CPU per request, %ld requests, "
                  "%zu record lines\n",
                  tls ? "https" : "http", body.compressed.size(), body.payload, r.requestsPerSecond,
                  r.cpuPerRequestUs, r.requests, r.recordLines);
    }
  }
  std::error_code ec;
  fs::remove_all(root, ec);
  return 0;
}
