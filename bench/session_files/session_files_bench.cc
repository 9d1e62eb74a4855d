// Cleanup and a full feedback walk over a large cache directory.
//
//   bench-session-files [--files N]   (default 100000)
//
// Fills a temporary cache directory with N files (mostly closed sessions,
// some orphaned open ones, some unparseable names, a share of custom feedback
// records), then times `vireon_cleanup` and a full `FeedbackEnumerator` walk
// and prints files per second and memory. The walk streams, so its peak
// resident size should not move with N; the pruning list, timed last, does.
#include "assembly/cache_paths.h"
#include "assembly/feedback_types.h"
#include "flushing/cache_layout.h"
#include "flushing/feedback_enumerator.h"
#include "platform/logging.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

namespace {

using Clock = std::chrono::steady_clock;

long peakRSSKiB() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_maxrss;
}

long currentRSSKiB() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmRSS:", 0) == 0) return std::strtol(line.c_str() + 6, nullptr, 10);
  }
  return -1;
}

void writeEmptyFile(const fbf::fs::path& path) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) {
    std::perror(path.c_str());
    std::exit(1);
  }
  static constexpr char kBytes[] = "session bytes";
  if (write(fd, kBytes, sizeof kBytes - 1) < 0) std::perror("write");
  close(fd);
}

std::string uuid(size_t n) {
  char buf[48];
  std::snprintf(buf, sizeof buf, "%08X-0000-4000-8000-00000000BEEF", static_cast<unsigned>(n));
  return buf;
}

void report(const char* phase, size_t files, Clock::duration elapsed) {
  double seconds = std::chrono::duration<double>(elapsed).count();
  std::printf("%-12s %8zu files  %8.3f s  %12.0f files/s  peak RSS %6ld KiB  RSS %6ld KiB\n", phase,
              files, seconds, seconds > 0 ? static_cast<double>(files) / seconds : 0.0,
              peakRSSKiB(), currentRSSKiB());
}

}  // namespace

int main(int argc, char** argv) {
  size_t total = 100000;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--files") == 0 && i + 1 < argc) {
      total = std::strtoul(argv[++i], nullptr, 10);
    } else {
      std::fprintf(stderr, "usage: %s [--files N]\n", argv[0]);
      return 2;
    }
  }
  fbf::logging::init();
  // Per-file log lines would measure the log sink, not the walk.
  fbf::logging::setLevel(spdlog::level::off);

  std::string tmpl = (fbf::fs::temp_directory_path() / "fbf-bench-XXXXXX").string();
  if (!mkdtemp(tmpl.data())) {
    std::perror("mkdtemp");
    return 1;
  }
  fbf::fs::path root = tmpl;
  auto dirs = fbf::XdgDirectories::underRoot(root);
  auto fm = fbf::makePosixFileManager(dirs);
  fbf::fs::path cacheDir = dirs.cacheHome / "vireond";
  fbf::fs::create_directories(cacheDir);
  fbf::createRequiredCacheSubdirectories(*fm);
  const auto& types = fbf::allCustomFeedbackDirectories();
  for (const auto& type : types) fbf::fs::create_directories(cacheDir / "CustomFeedback" / type);

  std::printf("bench-session-files: %zu files in %s\n", total, cacheDir.c_str());
  report("start", 0, {});
  auto t0 = Clock::now();
  size_t sessions = 0;
  for (size_t i = 0; i < total; ++i) {
    // 80 % session files (of which 1 in 10 open and 1 in 50 unparseable),
    // 20 % custom feedback spread over the types.
    if (i % 5 == 4) {
      writeEmptyFile(cacheDir / "CustomFeedback" / types[i % types.size()] /
                     ("record-" + std::to_string(i)));
    } else if (i % 50 == 0) {
      writeEmptyFile(cacheDir / ("session.garbage." + std::to_string(i)));
    } else {
      const char* state = i % 10 == 1 ? "open" : "closed";
      writeEmptyFile(cacheDir / ("session.4242." + uuid(i) + "." + state));
      ++sessions;
    }
  }
  report("create", total, Clock::now() - t0);

  // An hour on, every open file counts as orphaned and is renamed.
  auto now = std::chrono::system_clock::now() + std::chrono::hours(1);
  t0 = Clock::now();
  fbf::vireon_cleanup(*fm, now);
  report("cleanup", total, Clock::now() - t0);

  t0 = Clock::now();
  size_t yielded = 0;
  auto enumerator = fbf::FeedbackEnumerator::make(*fm);
  if (!enumerator) {
    std::fprintf(stderr, "no enumerator\n");
    return 1;
  }
  while (auto file = enumerator->next()) ++yielded;
  report("enumerate", yielded, Clock::now() - t0);

  t0 = Clock::now();
  auto pruned = fbf::vireon_getPrunedSessionFiles(*fm, 100);
  report("prune-list", sessions, Clock::now() - t0);
  std::printf("would prune %zu of %zu session files\n", pruned.size(), sessions);

  std::error_code ec;
  fbf::fs::remove_all(root, ec);
  return 0;
}
