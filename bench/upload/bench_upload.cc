// Upload path benchmark.
//
// 1. The compressing stream against plain zlib (level 5, raw DEFLATE) plus
//    SHA-512 over the same bytes, written in the same pieces.
// 2. Uploads per second through the libcurl session to fbf-ingest over HTTPS
//    on loopback, for 20 KB and 200 KB bodies.
//
// Run on demand; nothing here is asserted.
#include "platform/curl_http_session.h"
#include "support/bench_support.h"
#include "platform/task_queue.h"
#include "upload/compressed_output_stream.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zlib.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <vector>

extern char** environ;

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

namespace {

using fbf::bench::NullStream;
using fbf::bench::sampleData;

double seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

// CPU time of this thread: the machine may be shared, and the comparison is
// about the work each variant does.
double cpuSeconds() {
  timespec ts{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

double streamRun(const std::string& data, size_t piece, size_t& compressed) {
  auto out = std::make_shared<NullStream>();
  double start = cpuSeconds();
  fbf::CompressedOutputStream stream(out);
  stream.open();
  auto* p = reinterpret_cast<const uint8_t*>(data.data());
  for (size_t off = 0; off < data.size(); off += piece) stream.write(p + off, std::min(piece, data.size() - off));
  stream.close();
  compressed = out->bytes;
  return cpuSeconds() - start;
}

double plainRun(const std::string& data, size_t piece, size_t& compressed) {
  double start = cpuSeconds();
  z_stream z{};
  deflateInit2(&z, 5, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY);
  EVP_MD_CTX* sha = EVP_MD_CTX_new();
  EVP_DigestInit_ex(sha, EVP_sha512(), nullptr);
  std::vector<unsigned char> outBuf(4096);
  compressed = 0;
  auto* p = reinterpret_cast<const unsigned char*>(data.data());
  for (size_t off = 0; off <= data.size(); off += piece) {
    size_t n = off < data.size() ? std::min(piece, data.size() - off) : 0;
    bool last = off + n >= data.size();
    EVP_DigestUpdate(sha, p + off, n);
    z.next_in = const_cast<unsigned char*>(p + off);
    z.avail_in = static_cast<uInt>(n);
    int rc;
    do {
      z.next_out = outBuf.data();
      z.avail_out = static_cast<uInt>(outBuf.size());
      rc = deflate(&z, last ? Z_FINISH : Z_NO_FLUSH);
      compressed += outBuf.size() - z.avail_out;
    } while (z.avail_out == 0 || (last && rc != Z_STREAM_END));
    if (last) break;
  }
  unsigned char md[64];
  unsigned int len = 0;
  EVP_DigestFinal_ex(sha, md, &len);
  EVP_MD_CTX_free(sha);
  deflateEnd(&z);
  return cpuSeconds() - start;
}

void compressionBench() {
  const size_t size = 32 * 1024 * 1024;
  std::string data = sampleData(size);
  std::printf("compression of %zu MiB of session-like text (best of 5, thread CPU time)\n", size >> 20);
  for (size_t piece : {size_t{1024}, size_t{8192}}) {
    double best[2] = {1e9, 1e9};
    size_t out[2] = {0, 0};
    for (int round = 0; round < 5; ++round) {
      best[0] = std::min(best[0], streamRun(data, piece, out[0]));
      best[1] = std::min(best[1], plainRun(data, piece, out[1]));
    }
    double mb = static_cast<double>(size) / 1e6;
    std::printf("  writes of %5zu B: stream %7.1f MB/s (%zu B out), zlib+sha512 %7.1f MB/s (%zu B out), ratio %.3f\n",
                piece, mb / best[0], out[0], mb / best[1], out[1], best[1] / best[0]);
  }
}

// ---- uploads ----

struct Ingest {
  pid_t pid = -1;
  int port = 0;
  ~Ingest() {
    if (pid > 0) {
      kill(pid, SIGTERM);
      waitpid(pid, nullptr, 0);
    }
  }
};

bool startIngest(Ingest& ingest, const fs::path& bin, const fs::path& dir) {
  auto cert = dir / "cert.pem", key = dir / "key.pem", portFile = dir / "port";
  std::string cmd = "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 1"
                    " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout '" +
                    key.string() + "' -out '" + cert.string() + "' >/dev/null 2>&1";
  if (std::system(cmd.c_str()) != 0) return false;
  std::vector<std::string> args = {bin.string(), "--listen", "127.0.0.1:0", "--tls", cert.string(), key.string(),
                                   "--record", (dir / "record.jsonl").string(), "--port-file", portFile.string()};
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  if (posix_spawn(&ingest.pid, argv[0], nullptr, nullptr, argv.data(), environ) != 0) return false;
  for (int i = 0; i < 500 && ingest.port == 0; ++i) {
    std::ifstream in(portFile);
    if (!(in >> ingest.port)) std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return ingest.port != 0;
}

void uploadBench(const fs::path& ingestBin) {
  char tmpl[] = "/tmp/bench-upload-XXXXXX";
  if (!mkdtemp(tmpl)) return;
  fs::path dir = tmpl;
  Ingest ingest;
  if (!startIngest(ingest, ingestBin, dir)) {
    std::printf("uploads: could not start %s\n", ingestBin.c_str());
    fs::remove_all(dir);
    return;
  }
  std::shared_ptr<fbf::TaskQueue> queue = fbf::makeSerialQueue("bench.delegate");
  fbf::HttpSessionConfiguration config;
  config.delegateQueue = queue;
  config.caFile = dir / "cert.pem";
  auto session = fbf::makeCurlHttpSession(config);

  for (size_t size : {size_t{20 * 1024}, size_t{200 * 1024}}) {
    // A body as the uploader makes it: the compressed session text.
    fs::path body = dir / ("body-" + std::to_string(size));
    {
      auto mem = std::make_shared<fbf::MemoryOutputStream>();
      fbf::CompressedOutputStream stream(mem);
      stream.open();
      std::string data = sampleData(size);
      stream.write(reinterpret_cast<const uint8_t*>(data.data()), data.size());
      stream.close();
      std::ofstream(body, std::ios::binary) << mem->data();
      fs::permissions(body, fs::perms::owner_read | fs::perms::owner_write);
    }
    fbf::HttpRequest request;
    request.url = "https://127.0.0.1:" + std::to_string(ingest.port) + "/feedback?type=FeedbackV2&v=2";
    request.headers = {{"Content-Encoding", "deflate"}};
    const int count = 300;
    std::mutex m;
    std::condition_variable cv;
    int done = 0, ok = 0;
    auto start = Clock::now();
    for (int i = 0; i < count; ++i) {
      session->uploadFile(request, body, [&](std::optional<fbf::HttpResponse> r, std::optional<fbf::HttpError>) {
        std::lock_guard l(m);
        ++done;
        if (r && r->statusCode == 200) ++ok;
        cv.notify_all();
      });
    }
    std::unique_lock l(m);
    cv.wait_for(l, std::chrono::minutes(5), [&] { return done == count; });
    double elapsed = seconds(Clock::now() - start);
    std::printf("uploads of %3zu KB (compressed %zu B): %d/%d answered 200, %.1f uploads/s\n", size / 1024,
                static_cast<size_t>(fs::file_size(body)), ok, count, done / elapsed);
  }
  session.reset();
  queue.reset();
  fs::remove_all(dir);
}

}  // namespace

int main(int, char** argv) {
  compressionBench();
  uploadBench(fs::absolute(fs::path(argv[0])).parent_path() / "fbf-ingest");
  return 0;
}
