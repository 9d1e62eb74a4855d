// Runs the project's real programs from end-to-end tests.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <functional>
#include <vector>

namespace fbf::testing {

// The directory holding the built programs (FBF_BIN_DIR, set by ctest).
std::filesystem::path binDir();

// Environment for programs working in a throw-away XDG home under `root`.
std::map<std::string, std::string> xdgEnvironment(const std::filesystem::path& root);

class ChildProcess {
 public:
  // Starts `program` with `args` and exactly `env` (plus PATH); stdout and
  // stderr go to the given files.
  ChildProcess(const std::filesystem::path& program, const std::vector<std::string>& args,
               const std::map<std::string, std::string>& env, const std::filesystem::path& stdoutFile,
               const std::filesystem::path& stderrFile);
  ~ChildProcess();  // SIGKILLs and reaps a child still running
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  pid_t pid() const { return pid_; }
  void signal(int signo);
  // Exit status (or 128 + signal) if the child ended within `timeout`.
  std::optional<int> waitFor(std::chrono::milliseconds timeout);

 private:
  pid_t pid_ = -1;
  std::optional<int> status_;
};

// Runs a program to completion (bounded by `timeout`); returns its exit status
// and what it printed on stdout.
struct RunResult {
  int status = -1;
  std::string out;
  std::string err;
};
RunResult runProgram(const std::filesystem::path& program, const std::vector<std::string>& args,
                     const std::map<std::string, std::string>& env,
                     std::chrono::milliseconds timeout = std::chrono::seconds(60));

// Polls `predicate` every 20 ms until it holds or `timeout` passes.
bool waitUntil(const std::function<bool()>& predicate, std::chrono::milliseconds timeout);

}  // namespace fbf::testing
