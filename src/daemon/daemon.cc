#include "daemon/daemon.h"

#include "assembly/fbf_strings.h"
#include "cohorts/cohorts_usage_store.h"
#include "daemon/daemon_flush_runner.h"
#include "daemon/listener_socket.h"
#include "daemon/periodic_activity.h"
#include "flushing/session_recovery.h"
#include "ipc/flusher_service.h"
#include "platform/curl_http_session.h"
#include "upload/upload_manager.h"
#include "whitelist/installed_app_controller.h"
#include "platform/change_watcher.h"
#include "platform/logging.h"
#include "platform/device_info.h"
#include "upload/device_context.h"
#include "util/build_info.h"
#include "util/signpost.h"

#include <asio.hpp>

#include <sys/prctl.h>
#include <sys/stat.h>

#include <cstring>
#include <iostream>

namespace fbf {
namespace {

spdlog::logger& mainLog() { return logging::get("main"); }
spdlog::logger& assemblyLog() { return logging::get("FBFAssembly"); }

// Preference domains whose changes invalidate the app whitelist.
constexpr const char* kSearchUIDomain = "vireon.scoutlume";
constexpr const char* kAssistantDomain = "vireon.assistant";
// "Ask for a whitelist update soon".
constexpr uint64_t kUpdateSoon = 1;

class LinuxDaemon final : public Daemon {
 public:
  explicit LinuxDaemon(DaemonOptions options) : options_(std::move(options)) {}
  ~LinuxDaemon() override {
    // The activity's thread uses the scheduler, the assembly and the main
    // loop: stop it before any of them goes.
    if (activityQueue_) activityQueue_->shutdown();
    // Its jobs post back to the work queue and write through the file
    // manager, both the assembly's.
    if (encoderQueue_) encoderQueue_->shutdown();
  }

  void setup() {
    auto& dirs = options_.dirs;
    auto clock = options_.clock ? options_.clock : std::make_shared<SystemClock>();
    std::shared_ptr<FileManager> fm = makePosixFileManager(dirs);
    std::shared_ptr<PreferencesStore> prefs = makePlistPreferencesStore(dirs.preferencesDir(), *fm);
    auto vireondDefaults = prefs->defaultsForDomain(std::string(FBFStrings::VireondReverseDomainIdentifier));
    auto deviceInfo = std::shared_ptr<DeviceInfo>(makeLinuxDeviceInfo());
    installBuildInfoSource({
        [vireondDefaults] { return vireondDefaults->boolForKey(FBFStrings::LinuxDefaults::InternalBuild); },
        [deviceInfo] { return deviceInfo->value("BuildVersion").value_or(""); },
    });

    transactions_ = std::make_shared<TransactionRegistry>([this] {
      // Leave the main loop; whatever thread closed the last transaction.
      asio::post(io_, [this] { io_.stop(); });
    });

    // 1. The listener, so clients can connect as soon as the service exists.
    acceptor_ = openListenerSocket(io_, dirs.socketPath());

    // 2. The composition root.
    FBFAssemblyDependencies deps;
    deps.preferences = prefs;
    deps.fileManager = fm;
    deps.clock = clock;
    deps.analytics = makeJsonLinesAnalyticsSink(dirs.analyticsFile(), *fm, *clock);
    deps.transactions = transactions_;
    deps.lossLedger =
        std::make_shared<FeedbackLossLedger>(dirs.analyticsFile().parent_path() / "losses.jsonl", *fm, clock->now());
    deps.deviceContext = std::make_shared<DeviceContext>(*deviceInfo, kDaemonNameAndVersion);
    deps.httpSessionFactory = makeCurlHttpSession;
    deps.installedAppControllerFactory = [dirs](FBFAssembly& a) { return makeInstalledAppController(a, dirs); };
    assembly_ = std::make_unique<FBFAssembly>(std::move(deps));

    // Files an earlier run left half-way, before any flush of this run can
    // meet them (the work queue runs tasks in order).
    assembly_->workloop().async([this] {
      bool leave = assembly_->userDefaults().boolForKey(FBFStrings::Defaults::LeaveFeedbackAfterUpload);
      recoverInterruptedFiles(assembly_->fileManager(), leave);
    });

    // 3. Serve clients.
    // Sessions are compressed here while the work queue processes the next.
    encoderQueue_ = makeSerialQueue("vireon-fbf.encoder");
    auto flusherDependencies = [encoder = encoderQueue_] {
      FlusherDependencies d;
      d.uploadManagerFactory = UploadManager::factory(encoder);
      d.usageStoreFactory = [](FBFAssemblyProtocol& a) -> std::unique_ptr<FlushUsageStore> {
        return CohortsUsageStore::make(a);
      };
      return d;
    };
    auto runner = std::make_shared<DaemonFlushRunner>(*assembly_, flusherDependencies);
    service_ = std::make_unique<FlusherService>(*assembly_, runner);
    if (acceptor_) accept();

    // 4. The periodic flush.
    PeriodicActivityHooks hooks;
    hooks.beginFlush = [runner](std::function<void()> completion) {
      return runner->beginPeriodicFlush(std::move(completion));
    };
    hooks.invalidateListener = [this] {
      asio::post(io_, [this] {
        std::error_code ec;
        if (acceptor_) acceptor_->close(ec);
      });
    };
    hooks.onMainQueueAfter = [this](std::chrono::seconds delay, std::function<void()> task) {
      auto timer = std::make_shared<asio::steady_timer>(io_, delay);
      timer->async_wait([timer, task = std::move(task)](const std::error_code& ec) {
        if (!ec) task();
      });
    };
    hooks.requestCleanExit = [this] { transactions_->requestCleanExit(); };
    activityQueue_ = makeSerialQueue("vireon-fbf.activity");
    auto cacheDir = dirs.cacheHome / FBFStrings::VireondReverseDomainIdentifier;
    scheduler_ = std::make_unique<PeriodicActivityScheduler>(*assembly_, activityQueue_, makeSysfsPowerSource(),
                                                             std::move(hooks), cacheDir / "fbf-last-flush");
    scheduler_->start();

    // 5./6. Application and preference changes invalidate the whitelist.
    std::vector<WatchSpec> specs;
    specs.push_back({"applications", dirs.dataHome / "applications", ""});
    for (const auto& d : dirs.dataDirs) specs.push_back({"applications", d / "applications", ""});
    specs.push_back({"preferences", dirs.preferencesDir(), std::string(kSearchUIDomain) + ".plist"});
    specs.push_back({"preferences", dirs.preferencesDir(), std::string(kAssistantDomain) + ".plist"});
    watcher_ = makeInotifyWatcher(io_, std::move(specs), [this](const std::string& tag) {
      if (auto* controller = assembly_->installedAppController()) {
        mainLog().debug("{} changed; whitelist update requested", tag);
        controller->updateWhitelists(kUpdateSoon, nullptr);
      }
    });

    // 7./8. Termination signals only set flags and ask for a clean exit.
    signals_.add(SIGINT);
    signals_.add(SIGTERM);
    waitForSignal();
  }

  int run() override {
    io_.run();
    // A client may still be connected (waiting for its flush). Closing its
    // channel is posted to the loop, so run the loop once more after closing:
    // the closure releases the connection instead of leaving it unreachable.
    acceptor_.reset();
    service_.reset();
    io_.restart();
    io_.poll();
    return 0;
  }

  FBFAssembly& assembly() override { return *assembly_; }

 private:
  void waitForSignal() {
    signals_.async_wait([this](const std::error_code& ec, int signo) {
      if (ec) return;
      mainLog().debug(signo == SIGINT ? "fbf got SIGINT" : "fbf got SIGTERM");
      assembly_->setTerminating();
      transactions_->requestCleanExit();
      waitForSignal();
    });
  }

  void accept() {
    if (!acceptor_) return;
    acceptor_->async_accept([this](const std::error_code& ec, asio::local::stream_protocol::socket socket) {
      if (ec == asio::error::operation_aborted) return;
      if (!ec) {
        acceptFailing_ = false;
        acceptBackoff_ = kMinimumAcceptBackoff;
        onConnection(std::move(socket));
        accept();
        return;
      }
      // Out of descriptors (or another refusal): the pending connection stays
      // queued, so accepting again at once would spin. Wait, and say so once.
      if (!acceptFailing_) {
        mainLog().error("Cannot accept connections: {}; retrying with back-off", ec.message());
        acceptFailing_ = true;
      }
      acceptTimer_.expires_after(acceptBackoff_);
      acceptBackoff_ = std::min(acceptBackoff_ * 2, kMaximumAcceptBackoff);
      acceptTimer_.async_wait([this](const std::error_code& waitError) {
        if (!waitError) accept();
      });
    });
  }

  void onConnection(asio::local::stream_protocol::socket socket) {
    if (service_) service_->accept(std::move(socket));
  }

  static constexpr std::chrono::milliseconds kMinimumAcceptBackoff{50};
  static constexpr std::chrono::milliseconds kMaximumAcceptBackoff{2000};

  DaemonOptions options_;
  asio::io_context io_;
  asio::steady_timer acceptTimer_{io_};
  std::chrono::milliseconds acceptBackoff_ = kMinimumAcceptBackoff;
  bool acceptFailing_ = false;
  asio::signal_set signals_{io_};
  std::shared_ptr<TransactionRegistry> transactions_;
  std::optional<UnixAcceptor> acceptor_;
  std::unique_ptr<FBFAssembly> assembly_;
  // Destroyed before the assembly: closes every open connection.
  std::unique_ptr<FlusherService> service_;
  std::shared_ptr<TaskQueue> activityQueue_;
  std::shared_ptr<TaskQueue> encoderQueue_;
  std::unique_ptr<PeriodicActivityScheduler> scheduler_;
  std::unique_ptr<ChangeWatcher> watcher_;
};

}  // namespace

std::unique_ptr<Daemon> Daemon::setup(DaemonOptions options) {
  auto d = std::make_unique<LinuxDaemon>(std::move(options));
  d->setup();
  return d;
}

int daemonMain(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--version") == 0) {
      std::cout << kDaemonNameAndVersion << "\n";
      return 0;
    }
    if (std::strcmp(argv[i], "--help") == 0) {
      std::cout << "usage: vireon-fbf\n\nThe background feedback flusher. Takes no arguments; see README.md.\n";
      return 0;
    }
  }
  // Confine ourselves even when started by hand, outside the service unit:
  // everything written is owner-only, and a crash never dumps the user's
  // sessions into a core file (this also keeps other processes of the same
  // user from attaching with ptrace or reading our memory through /proc).
  ::umask(0077);
  ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0);
  logging::init();
  vireon_signpost_launchBegin();
  assemblyLog().info("main");
  auto daemon = Daemon::setup(DaemonOptions{});
  assemblyLog().info("setup");
  vireon_signpost_launchEnd();
  return daemon->run();
}

}  // namespace fbf
