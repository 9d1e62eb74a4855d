#include "support/process.h"

#include "support/test_support.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <thread>

namespace fbf::testing {

std::filesystem::path binDir() {
  const char* d = std::getenv("FBF_BIN_DIR");
  return d ? std::filesystem::path(d) : std::filesystem::current_path() / "bin";
}

std::map<std::string, std::string> xdgEnvironment(const std::filesystem::path& root) {
  auto dirs = XdgDirectories::underRoot(root);
  std::filesystem::create_directories(dirs.cacheHome / "vireond");
  std::filesystem::create_directories(dirs.runtimeDir);
  std::filesystem::permissions(dirs.runtimeDir, std::filesystem::perms::owner_all);
  return {
      {"HOME", root.string()},
      {"XDG_CACHE_HOME", dirs.cacheHome.string()},
      {"XDG_CONFIG_HOME", dirs.configHome.string()},
      {"XDG_STATE_HOME", dirs.stateHome.string()},
      {"XDG_DATA_HOME", dirs.dataHome.string()},
      {"XDG_DATA_DIRS", dirs.dataDirs.front().string()},
      {"XDG_RUNTIME_DIR", dirs.runtimeDir.string()},
      {"VIREON_FBF_LOG_LEVEL", "debug"},
  };
}

namespace {
std::vector<std::string> envStrings(const std::map<std::string, std::string>& env) {
  std::vector<std::string> out;
  bool hasPath = false;
  for (const auto& [k, v] : env) {
    out.push_back(k + "=" + v);
    hasPath |= k == "PATH";
  }
  if (!hasPath) out.push_back(std::string("PATH=") + (std::getenv("PATH") ? std::getenv("PATH") : "/usr/bin:/bin"));
  // Sanitizer settings of the test run apply to the children too.
  for (const char* k : {"ASAN_OPTIONS", "UBSAN_OPTIONS", "LSAN_OPTIONS", "TZ"}) {
    if (const char* v = std::getenv(k); v && !env.count(k)) out.push_back(std::string(k) + "=" + v);
  }
  return out;
}

int decode(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}
}  // namespace

ChildProcess::ChildProcess(const std::filesystem::path& program, const std::vector<std::string>& args,
                           const std::map<std::string, std::string>& env, const std::filesystem::path& stdoutFile,
                           const std::filesystem::path& stderrFile) {
  auto envs = envStrings(env);
  std::vector<char*> argv{const_cast<char*>(program.c_str())};
  for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  std::vector<char*> envp;
  for (auto& e : envs) envp.push_back(e.data());
  envp.push_back(nullptr);

  pid_ = fork();
  if (pid_ == 0) {
    int out = open(stdoutFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    int err = open(stderrFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    int in = open("/dev/null", O_RDONLY);
    dup2(in, 0);
    dup2(out, 1);
    dup2(err, 2);
    // Children must not inherit the test's blocked/ignored signals.
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    ::signal(SIGTERM, SIG_DFL);
    ::signal(SIGINT, SIG_DFL);
    execve(program.c_str(), argv.data(), envp.data());
    _exit(127);
  }
}

ChildProcess::~ChildProcess() {
  if (pid_ > 0 && !status_) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
}

void ChildProcess::signal(int signo) {
  if (pid_ > 0 && !status_) kill(pid_, signo);
}

std::optional<int> ChildProcess::waitFor(std::chrono::milliseconds timeout) {
  if (status_) return status_;
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (true) {
    int st = 0;
    pid_t r = waitpid(pid_, &st, WNOHANG);
    if (r == pid_) {
      status_ = decode(st);
      return status_;
    }
    if (std::chrono::steady_clock::now() >= deadline) return std::nullopt;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
}

RunResult runProgram(const std::filesystem::path& program, const std::vector<std::string>& args,
                     const std::map<std::string, std::string>& env, std::chrono::milliseconds timeout) {
  TempDir tmp;
  RunResult r;
  {
    ChildProcess p(program, args, env, tmp.path() / "out", tmp.path() / "err");
    auto st = p.waitFor(timeout);
    r.status = st ? *st : -1;
  }
  r.out = readFile(tmp.path() / "out");
  r.err = readFile(tmp.path() / "err");
  return r;
}

bool waitUntil(const std::function<bool()>& predicate, std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!predicate()) {
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return true;
}

}  // namespace fbf::testing
