// The command-line client of the daemon, callable in-process so tests can run
// it against a daemon of their own.
#pragma once

#include "platform/xdg.h"

#include <functional>
#include <ostream>
#include <string>
#include <vector>

namespace fbf::fbfctl {

struct Environment {
  XdgDirectories dirs = XdgDirectories::fromEnvironment();
  std::ostream* out = nullptr;
  std::ostream* err = nullptr;
};

// Runs one command line (without the program name) and returns the exit
// status: 0 on success, 1 when the command failed, 2 for a usage error.
// Every failure writes one line "fbfctl: <reason>" to `err`.
int run(const std::vector<std::string>& args, const Environment& env);

}  // namespace fbf::fbfctl
