// The whitelist signature through the real daemon and fbfctl, in a
// throw-away XDG home: desktop entries and the whitelist resource are written
// here; the stored signature is read from the preferences file and checked
// with the tests' own signature reader. Few daemon launches, no sleeps: the
// "soon" delay is set to zero and changes are polled for.
#include "e2e/daemon_home.h"
#include "whitelist/signature_decoder.h"

#include <fmt/format.h>
#include <sys/stat.h>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

std::string applicationEntry(std::string_view name) {
  return fmt::format("[Desktop Entry]\nType=Application\nName={}\nExec={}\n", name, name);
}

// The outer resource document around an inner whitelist of {bundle: encoding id}.
std::string whitelistDocument(const std::map<std::string, uint64_t>& ids) {
  nlohmann::json apps = nlohmann::json::object();
  for (const auto& [bundle, id] : ids) apps[bundle] = nlohmann::json::array({{{"encoding_id", id}}});
  nlohmann::json inner = {{"version", "0a1F"}, {"apps", apps}};
  return nlohmann::json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump();
}

::testing::AssertionResult carries(const std::optional<std::string>& signature, const std::vector<uint64_t>& ids) {
  if (!signature) return ::testing::AssertionFailure() << "no signature";
  std::string why;
  auto decoded = decodeSignature(*signature, &why);
  if (!decoded) return ::testing::AssertionFailure() << "'" << *signature << "' rejected: " << why;
  if (decoded->version != 0x0a1f)
    return ::testing::AssertionFailure() << "version word " << std::hex << decoded->version;
  if (decoded->bitmap != bitmapOf(ids)) return ::testing::AssertionFailure() << "bitmap differs";
  return ::testing::AssertionSuccess();
}

// A daemon kept alive after its periodic run, with "soon" meaning at once,
// over a home with application directories in the data home and in the one
// shared data dir.
class WhitelistDaemon : public ::testing::Test {
 protected:
  WhitelistDaemon() {
    fs::create_directories(userApps());
    fs::create_directories(sharedApps());
    vireond->setObject("FBFNoExit", true);
    vireond->setObject("VIRWhitelistSoonDelaySeconds", 0);
  }

  // A clean exit on SIGTERM, so that a sanitizer finding in the daemon fails the test.
  void TearDown() override {
    if (home.daemon() && !home.daemon()->waitFor(0ms)) {
      EXPECT_EQ(home.stopDaemon(), 0) << log();
    }
  }

  fs::path userApps() const { return dirs.dataHome / "applications"; }
  fs::path sharedApps() const { return dirs.dataDirs.front() / "applications"; }
  fs::path userResource() const { return dirs.dataHome / "vireond" / "app-whitelist.json"; }
  fs::path assistantList() const { return home.cacheDir() / "assistant-apps.json"; }
  std::string log() const { return home.daemonLog(); }
  bool logged(const std::string& line) const { return log().find(line) != std::string::npos; }
  void startDaemon() {
    home.startDaemon();
    ASSERT_TRUE(logged("setup")) << log();
  }

  // What `fbfctl update-whitelists CONDITION` printed; fails the test on a non-zero exit.
  std::string update(const std::string& condition) {
    auto r = home.fbfctl({"update-whitelists", condition});
    EXPECT_EQ(r.status, 0) << r.err << log();
    while (!r.out.empty() && r.out.back() == '\n') r.out.pop_back();
    return r.out;
  }

  std::optional<std::string> stored() { return vireond->stringForKey("VIRAppWhitelistSignature"); }

  // Waits for the daemon to store a signature carrying exactly `ids`.
  ::testing::AssertionResult eventuallyStores(const std::vector<uint64_t>& ids) {
    if (waitUntil([&] { return bool(carries(stored(), ids)); }, 30s))
      return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "stored: " << stored().value_or("(none)") << "\n" << log();
  }

  DaemonHome home;
  XdgDirectories dirs = XdgDirectories::underRoot(home.root());
  std::shared_ptr<FileManager> files = makePosixFileManager(dirs);
  std::unique_ptr<PreferencesStore> store = makePlistPreferencesStore(dirs.preferencesDir(), *files);
  std::shared_ptr<UserDefaults> vireond = store->defaultsForDomain("vireond");
};

// Guards against: wrong entries, resource or assistant list read, a condition ignored, a fresh list redone.
TEST_F(WhitelistDaemon, EachConditionPrintsAndStoresTheSignatureOfInstalledWhitelistedApps) {
  const std::string hidden = "[Desktop Entry]\nType=Application\nName=Notes\nHidden=true\n";
  const std::string intents = applicationEntry("Todo") + "Implements=vireon.Intents\n";
  const std::pair<fs::path, std::string> files[] = {
      {userApps() / "org.example.Mail.desktop", applicationEntry("Mail")},
      {userApps() / "vendor" / "tool.desktop", applicationEntry("Tool")},
      {userApps() / "a" / "b" / "c.desktop", applicationEntry("C")},
      {userApps() / "shown.desktop", applicationEntry("Shown") + "NoDisplay=true\n"},
      {userApps() / "org.example.Todo.desktop", intents},
      {userApps() / "org.vireon.Notes.desktop", applicationEntry("Notes")},
      {userApps() / "org.example.Notes.desktop", hidden},
      {userApps() / "org.example.Site.desktop", "[Desktop Entry]\nType=Link\nName=Site\nURL=https://x.org\n"},
      {userApps() / "readme.txt", applicationEntry("Readme")},
      {userApps() / "org.example.Broken.desktop", "this is not a key file\n"},
      {sharedApps() / "org.example.Maps.desktop", applicationEntry("Maps")},
      {sharedApps() / "org.example.Notes.desktop", applicationEntry("Notes")},
      {sharedApps() / "org.example.Broken.desktop", applicationEntry("Broken")},
      {sharedApps() / "vendor-tool.desktop", intents},
  };
  for (const auto& [path, text] : files) writeFile(path, text);
  fs::create_directory_symlink(userApps(), userApps() / "loop");
  std::map<std::string, uint64_t> ids = {
      {"org.example.Mail", 0}, {"org.example.Todo", 1}, {"a-b-c", 2}, {"org.example.Maps", 3}, {"shown", 4},
      {"org.example.Notes", 5}, {"org.example.Site", 7}, {"org.example.Broken", 8}, {"vendor-tool", 9},
      {"readme", 11}, {"org.example.NotInstalled", 12}, {"loop-org.example.Mail", 13}};
  writeFile(dirs.dataDirs.front() / "vireond" / "app-whitelist.json", whitelistDocument(ids));
  ASSERT_TRUE(store->defaultsForDomain("vireon.assistant")->setObject("Assistant Enabled", true));
  ASSERT_TRUE(store->defaultsForDomain("vireon.scoutlume")
                  ->setObject("DisabledApplications", PropertyList::array({"org.vireon.Notes"})));
  ASSERT_NO_FATAL_FAILURE(startDaemon());

  // No assistant list yet: stale.
  auto printed = update("if-stale");
  EXPECT_TRUE(carries(printed, {0, 1, 2, 3, 4, 9}));
  EXPECT_EQ(stored(), printed);
  EXPECT_EQ(readFile(assistantList()), R"(["org.example.Todo","vireon.vexa.nonAppSuggestion"])");
  EXPECT_TRUE(logged("updated signature user default"));
  EXPECT_TRUE(logged("could not read desktop entry " + (userApps() / "org.example.Broken.desktop").string()));

  // The data home's resource wins over the shared one, but a fresh list is
  // not regenerated until it is two days old.
  ids["org.example.Mail"] = 40;
  writeFile(userResource(), whitelistDocument(ids));
  EXPECT_TRUE(carries(update("if-stale"), {0, 1, 2, 3, 4, 9}));
  EXPECT_TRUE(logged("whitelist already up-to-date"));
  fs::last_write_time(assistantList(), fs::file_time_type::clock::now() - 49h);
  EXPECT_TRUE(carries(update("if-stale"), {1, 2, 3, 4, 9, 40}));

  ids["org.example.Mail"] = 41;
  writeFile(userResource(), whitelistDocument(ids));
  EXPECT_TRUE(carries(update("soon"), {1, 2, 3, 4, 9, 41}));
  EXPECT_TRUE(logged("update whitelists soon"));
  ids["org.example.Mail"] = 20;
  writeFile(userResource(), whitelistDocument(ids));
  EXPECT_TRUE(carries(update("now"), {1, 2, 3, 4, 9, 20}));
  EXPECT_TRUE(carries(stored(), {1, 2, 3, 4, 9, 20}));

  auto refused = home.fbfctl({"update-whitelists", "later"});
  EXPECT_NE(refused.status, 0);
  EXPECT_NE(refused.err.find("later"), std::string::npos) << refused.err;
}

// Guards against: an unusable resource leaving an old signature, going unlogged, or stopping the daemon.
TEST_F(WhitelistDaemon, UnusableResourceRemovesTheSignatureAndTheDaemonKeepsServing) {
  struct Row {
    const char* name;
    std::function<void()> plant;
    const char* logLine;
  };
  auto writes = [&](std::string text) { return [this, text] { writeFile(userResource(), text); }; };
  const Row rows[] = {
      {"missing", [] {}, "Could not obtain file handle for installed app whitelist"},
      {"directory", [&] { fs::create_directories(userResource()); }, "not a regular file"},
      // Opened without blocking: a FIFO must not stall the daemon.
      {"fifo", [&] { ASSERT_EQ(mkfifo(userResource().c_str(), 0600), 0); }, "not a regular file"},
      {"empty", writes(""), "mappedData is nil"},
      {"truncated", writes(whitelistDocument({{"org.example.Mail", 11}}).substr(0, 40)),
       "installed app whitelist vireond/app-whitelist.json is malformed"},
      {"no installed app listed", writes(whitelistDocument({{"org.example.Elsewhere", 4}})),
       "no installed application is whitelisted"},
  };
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    ASSERT_TRUE(vireond->setObject("VIRAppWhitelistSignature", "old"));
    fs::remove_all(userResource());
    row.plant();
    EXPECT_EQ(update("now"), "no signature");
    EXPECT_EQ(stored(), std::nullopt);
    EXPECT_TRUE(logged(row.logLine)) << log();
    EXPECT_EQ(readFile(assistantList()), "[]");  // the assistant is off
  }
  fs::remove_all(userResource());
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 11}}));
  EXPECT_TRUE(carries(update("now"), {11}));
}

// Guards against: application or preference changes going unwatched while the daemon runs.
TEST_F(WhitelistDaemon, ApplicationAndPreferenceChangesRegenerateTheSignature) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 0}, {"org.example.Maps", 3},
                                               {"org.example.Notes", 17}, {"org.example.Clock", 21}}));
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  ASSERT_TRUE(carries(update("now"), {0}));

  writeFile(sharedApps() / "org.example.Maps.desktop", applicationEntry("Maps"));
  EXPECT_TRUE(eventuallyStores({0, 3}));
  EXPECT_TRUE(logged("applications changed; whitelist update requested"));

  writeFile(home.root() / "org.example.Notes.desktop.tmp", applicationEntry("Notes"));
  fs::rename(home.root() / "org.example.Notes.desktop.tmp", userApps() / "org.example.Notes.desktop");
  EXPECT_TRUE(eventuallyStores({0, 3, 17}));

  ASSERT_TRUE(store->defaultsForDomain("vireon.scoutlume")
                  ->setObject("DisabledApplications", PropertyList::array({"org.example.Mail"})));
  EXPECT_TRUE(eventuallyStores({3, 17}));
  EXPECT_TRUE(logged("preferences changed; whitelist update requested"));

  fs::remove(userApps() / "org.example.Notes.desktop");
  EXPECT_TRUE(eventuallyStores({3}));
}

}  // namespace
}  // namespace fbf::testing
