// Session post-processing throughput.
//
//   bench-processing [--sessions N] [--seed S] [--size-mix small|realistic|large] [--rounds R]
//
// Writes N generated session files into a temporary cache directory, reads
// them back, and times over the same bytes: decode + encode alone, and
// decode + post-process + encode, each for the protobuf and the JSON upload
// form. Prints sessions per second and MB per second of session file bytes.
#include "flushing/flushable_session.h"
#include "session_generator.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <string>
#include <string_view>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
using corevireon::CVClientSession;

struct Result {
  double seconds = 0;
  size_t outputBytes = 0;
};

// Runs `body` over every file `rounds` times.
Result timeIt(const std::vector<std::string>& files, int rounds,
              const std::function<size_t(const std::string&)>& body) {
  Result r;
  const auto start = Clock::now();
  for (int i = 0; i < rounds; ++i) {
    for (const auto& bytes : files) r.outputBytes += body(bytes);
  }
  r.seconds = std::chrono::duration<double>(Clock::now() - start).count();
  return r;
}

CVClientSession decode(const std::string& bytes) {
  CVClientSession s;
  if (!s.ParseFromString(bytes)) {
    std::fprintf(stderr, "generated session does not decode\n");
    std::exit(1);
  }
  return s;
}

}  // namespace

int main(int argc, char** argv) {
  int sessions = 300, rounds = 3;
  fbf::sessiongen::GeneratorOptions options;
  options.seed = 42;
  for (int i = 1; i + 1 < argc; i += 2) {
    std::string_view arg = argv[i];
    if (arg == "--sessions") {
      sessions = std::atoi(argv[i + 1]);
    } else if (arg == "--rounds") {
      rounds = std::atoi(argv[i + 1]);
    } else if (arg == "--seed") {
      options.seed = std::strtoull(argv[i + 1], nullptr, 10);
    } else if (arg == "--size-mix") {
      auto mix = fbf::sessiongen::sizeMixFromString(argv[i + 1]);
      if (!mix) {
        std::fprintf(stderr, "--size-mix is small, realistic or large\n");
        return 2;
      }
      options.sizeMix = *mix;
    } else {
      std::fprintf(stderr, "unknown option %s\n", argv[i]);
      return 2;
    }
  }
  if (sessions < 1 || rounds < 1) {
    std::fprintf(stderr, "--sessions and --rounds must be positive\n");
    return 2;
  }

  std::string dirTemplate = (std::filesystem::temp_directory_path() / "bench-processing.XXXXXX").string();
  if (mkdtemp(dirTemplate.data()) == nullptr) {
    std::perror("mkdtemp");
    return 1;
  }
  const std::filesystem::path dir = dirTemplate;
  fbf::sessiongen::SessionGenerator generator(options);
  std::string error;
  auto summary = fbf::sessiongen::writeCacheDirectory(dir / "vireond", sessions, 0, generator, &error);
  if (!summary) {
    std::fprintf(stderr, "%s\n", error.c_str());
    return 1;
  }
  std::vector<std::string> files;
  size_t inputBytes = 0;
  for (const auto& path : summary->sessionFiles) {
    std::ifstream in(path, std::ios::binary);
    files.emplace_back(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    inputBytes += files.back().size();
  }
  std::filesystem::remove_all(dir);

  std::printf("%d sessions, %.1f MB of session files, %d rounds\n", sessions, inputBytes / 1e6, rounds);
  std::printf("%-44s %12s %10s %12s\n", "", "sessions/s", "MB/s", "out MB/round");

  auto report = [&](const char* name, const Result& r) {
    const double n = static_cast<double>(files.size()) * rounds;
    std::printf("%-44s %12.0f %10.1f %12.1f\n", name, n / r.seconds, inputBytes * rounds / 1e6 / r.seconds,
                r.outputBytes / 1e6 / rounds);
  };

  report("decode + encode protobuf", timeIt(files, rounds, [](const std::string& bytes) {
           return decode(bytes).SerializeAsString().size();
         }));
  report("decode + post-process + encode protobuf", timeIt(files, rounds, [](const std::string& bytes) {
           fbf::FlushableSession session(decode(bytes));
           session.postProcessFeedback(nullptr);
           return session.backingStore().SerializeAsString().size();
         }));
  // As the daemon does it: decoded into an arena of the session's own.
  report("the same, decoded into an arena", timeIt(files, rounds, [](const std::string& bytes) {
           auto session = fbf::FlushableSession::decode(bytes);
           session->postProcessFeedback(nullptr);
           return session->backingStore().SerializeAsString().size();
         }));
  report("decode + JSON", timeIt(files, rounds, [](const std::string& bytes) {
           return fbf::FlushableSession(decode(bytes)).generateSessionJSON().dump().size();
         }));
  report("decode + post-process + JSON", timeIt(files, rounds, [](const std::string& bytes) {
           fbf::FlushableSession session(decode(bytes));
           session.postProcessFeedback(nullptr);
           return session.generateSessionJSON().dump().size();
         }));
  return 0;
}
