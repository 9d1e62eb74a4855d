// Start-up and run loop of the daemon.
//
// `setup` builds the composition root and every long-lived object, opens the
// IPC socket, installs the SIGINT/SIGTERM sources and the change watchers;
// `run` parks the calling thread in the main loop until a clean exit (the
// exit was requested and no transaction is open). `daemonMain` does both and
// is what `main` calls, so an end-to-end test can run the daemon in-process.
#pragma once

#include "assembly/fbf_assembly.h"
#include "platform/xdg.h"

#include <functional>
#include <memory>

namespace fbf {

struct DaemonOptions {
  XdgDirectories dirs = XdgDirectories::fromEnvironment();
  std::shared_ptr<const Clock> clock;  // the system clock when null
};

class Daemon {
 public:
  static std::unique_ptr<Daemon> setup(DaemonOptions options);
  virtual ~Daemon() = default;
  // Returns the process exit status.
  virtual int run() = 0;
  virtual FBFAssembly& assembly() = 0;
};

int daemonMain(int argc, char** argv);

}  // namespace fbf
