// fbf-sessiongen --out DIR --sessions N [--custom N] [--seed S] [--canaries FILE]
//                [--size-mix small|realistic|large] [--days N]
// Writes generated closed session files and custom feedback files into a
// cache directory as the daemon sees it; see session_generator.h.
#include "session_generator.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <fmt/format.h>
#include <string>
#include <string_view>

namespace {

constexpr std::string_view kUsage =
    "usage: fbf-sessiongen --out DIR --sessions N [--custom N] [--seed S] [--canaries FILE]\n"
    "                      [--size-mix small|realistic|large] [--days N]\n";

int fail(const std::string& reason) {
  std::fprintf(stderr, "fbf-sessiongen: %s\n", reason.c_str());
  return 2;
}

template <class T>
bool parseNumber(std::string_view text, T& out) {
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), out);
  return ec == std::errc() && end == text.data() + text.size();
}

}  // namespace

int main(int argc, char** argv) {
  std::string out;
  std::string canariesFile;
  int sessions = -1;
  int custom = 0;
  fbf::sessiongen::GeneratorOptions options;
  options.now = std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();

  for (int i = 1; i < argc; ++i) {
    std::string_view arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage.data(), stdout);
      return 0;
    }
    if (i + 1 >= argc) return fail(fmt::format("{} needs a value\n{}", arg, kUsage));
    std::string_view value = argv[++i];
    if (arg == "--out") {
      out = value;
    } else if (arg == "--sessions") {
      if (!parseNumber(value, sessions) || sessions < 0) return fail("--sessions needs a non-negative number");
    } else if (arg == "--custom") {
      if (!parseNumber(value, custom) || custom < 0) return fail("--custom needs a non-negative number");
    } else if (arg == "--seed") {
      if (!parseNumber(value, options.seed)) return fail("--seed needs an unsigned number");
    } else if (arg == "--canaries") {
      canariesFile = value;
      options.plantCanaries = true;
    } else if (arg == "--size-mix") {
      auto mix = fbf::sessiongen::sizeMixFromString(value);
      if (!mix) return fail("--size-mix is small, realistic or large");
      options.sizeMix = *mix;
    } else if (arg == "--days") {
      if (!parseNumber(value, options.days) || options.days < 1) return fail("--days needs a positive number");
    } else {
      return fail(fmt::format("unknown option {}\n{}", arg, kUsage));
    }
  }
  if (out.empty() || sessions < 0) return fail(fmt::format("--out and --sessions are required\n{}", kUsage));

  fbf::sessiongen::SessionGenerator generator(options);
  std::string error;
  auto summary = fbf::sessiongen::writeCacheDirectory(out, sessions, custom, generator, &error);
  if (!summary) return fail(error);

  if (!canariesFile.empty()) {
    std::string text;
    for (const auto& c : summary->canaries) text += c + "\n";
    const int fd = ::open(canariesFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0) return fail(fmt::format("cannot write {}: {}", canariesFile, std::strerror(errno)));
    const bool ok = ::write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    ::close(fd);
    if (!ok) return fail(fmt::format("cannot write {}", canariesFile));
  }

  auto sizes = summary->sessionSizes;
  std::sort(sizes.begin(), sizes.end());
  uint64_t total = 0;
  for (auto s : sizes) total += s;
  fmt::print("wrote {} session files ({} bytes, median {}, largest {}) and {} custom feedback files to {}\n",
             sizes.size(), total, sizes.empty() ? 0 : sizes[sizes.size() / 2], sizes.empty() ? 0 : sizes.back(),
             summary->customFeedbackFiles.size(), out);
  if (!canariesFile.empty()) fmt::print("planted {} canaries, listed in {}\n", summary->canaries.size(), canariesFile);
  return 0;
}
