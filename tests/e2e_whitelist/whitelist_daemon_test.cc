// The whitelist signature through the real daemon and fbfctl, in a
// throw-away XDG home: desktop entries and the whitelist resource are written
// here, the stored signature is read back through `fbfctl defaults` and
// checked with the tests' own signature reader.
#include "platform/file_manager.h"
#include "platform/user_defaults.h"
#include "support/process.h"
#include "support/test_support.h"
#include "whitelist/signature_decoder.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

constexpr uint16_t kVersionWord = 0x0a1f;  // the version "0a1F"

std::string trimmed(std::string text) {
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
  return text;
}

std::string applicationEntry(std::string_view name) {
  return fmt::format("[Desktop Entry]\nType=Application\nName={}\nExec={}\n", name, name);
}

// The outer resource document around an inner whitelist of
// {bundle identifier: encoding id}.
std::string whitelistDocument(const std::map<std::string, uint64_t>& ids, std::string version = "0a1F") {
  nlohmann::json apps = nlohmann::json::object();
  for (const auto& [bundle, id] : ids) apps[bundle] = nlohmann::json::array({{{"encoding_id", id}}});
  nlohmann::json inner = {{"version", version}, {"apps", apps}};
  return nlohmann::json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump();
}

// A daemon (kept alive after its periodic run) over a home with empty
// application directories in the data home and in the one shared data dir.
class WhitelistDaemon : public ::testing::Test {
 protected:
  WhitelistDaemon() : env(xdgEnvironment(home.path())), dirs(XdgDirectories::underRoot(home.path())) {
    fs::create_directories(userApps());
    fs::create_directories(sharedApps());
    auto set = ctl({"defaults", "write", "vireond", "FBFNoExit", "-bool", "true"});
    EXPECT_EQ(set.status, 0) << set.err;
  }

  // A clean exit on SIGTERM, so that a sanitizer finding in the daemon fails
  // the test that caused it.
  void TearDown() override {
    if (!daemonRunning()) return;
    daemon->signal(SIGTERM);
    EXPECT_EQ(daemon->waitFor(20s), 0) << daemonLog();
  }

  fs::path userApps() const { return dirs.dataHome / "applications"; }
  fs::path sharedApps() const { return dirs.dataDirs.front() / "applications"; }
  fs::path userResource() const { return dirs.dataHome / "vireond" / "app-whitelist.json"; }
  fs::path sharedResource() const { return dirs.dataDirs.front() / "vireond" / "app-whitelist.json"; }
  fs::path assistantList() const { return dirs.cacheHome / "vireond" / "assistant-apps.json"; }
  std::string daemonLog() const { return readFile(home.path() / "daemon.err"); }

  void startDaemon() {
    daemon = std::make_unique<ChildProcess>(binDir() / "vireon-fbf", std::vector<std::string>{}, env,
                                            home.path() / "daemon.out", home.path() / "daemon.err");
    ASSERT_TRUE(waitUntil([&] { return fs::exists(dirs.socketPath()) && daemonLog().find("setup") != std::string::npos; },
                          20s))
        << daemonLog();
  }

  bool daemonRunning() { return daemon && !daemon->waitFor(0ms); }

  RunResult ctl(const std::vector<std::string>& args) { return runProgram(binDir() / "fbfctl", args, env); }

  // What `fbfctl update-whitelists CONDITION` printed; fails the test on a
  // non-zero exit.
  std::string updateWhitelists(const std::string& condition) {
    auto r = ctl({"update-whitelists", condition});
    EXPECT_EQ(r.status, 0) << r.err << daemonLog();
    return trimmed(r.out);
  }

  std::optional<std::string> storedSignature() {
    auto r = ctl({"defaults", "read", "vireond", "VIRAppWhitelistSignature"});
    if (r.status != 0) return std::nullopt;
    return trimmed(r.out);
  }

  // The bitmap the stored signature carries; no value without one or when
  // the reader rejects it.
  std::optional<std::vector<uint8_t>> storedBitmap() {
    auto signature = storedSignature();
    if (!signature) return std::nullopt;
    auto decoded = decodeSignature(*signature, nullptr);
    if (!decoded) return std::nullopt;
    return decoded->bitmap;
  }

  // Waits for the daemon to store a signature carrying exactly `ids`.
  ::testing::AssertionResult eventuallyStores(const std::vector<uint64_t>& ids) {
    auto expected = bitmapOf(ids);
    if (waitUntil([&] { return storedBitmap() == expected; }, 30s)) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "stored: " << storedSignature().value_or("(none)") << "\n" << daemonLog();
  }

  void setPreference(const std::string& domain, std::string_view key, const PropertyList& value) {
    auto files = makePosixFileManager(dirs);
    auto store = makePlistPreferencesStore(dirs.preferencesDir(), *files);
    ASSERT_TRUE(store->defaultsForDomain(domain)->setObject(key, value));
  }

  TempDir home;
  std::map<std::string, std::string> env;
  XdgDirectories dirs;
  std::unique_ptr<ChildProcess> daemon;
};

::testing::AssertionResult carries(const std::string& signature, const std::vector<uint64_t>& ids) {
  std::string why;
  auto decoded = decodeSignature(signature, &why);
  if (!decoded) return ::testing::AssertionFailure() << "'" << signature << "' rejected: " << why;
  if (decoded->version != kVersionWord)
    return ::testing::AssertionFailure() << "version word " << std::hex << decoded->version;
  if (decoded->bitmap != bitmapOf(ids)) return ::testing::AssertionFailure() << "bitmap differs";
  return ::testing::AssertionSuccess();
}

TEST_F(WhitelistDaemon, NowPrintsAndStoresTheSignatureOfTheInstalledWhitelistedApplications) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(userApps() / "vendor" / "tool.desktop", applicationEntry("Tool"));  // id "vendor-tool"
  writeFile(sharedApps() / "org.example.Maps.desktop", applicationEntry("Maps"));
  // The user's hidden copy shadows the shared entry.
  writeFile(sharedApps() / "org.example.Notes.desktop", applicationEntry("Notes"));
  writeFile(userApps() / "org.example.Notes.desktop", "[Desktop Entry]\nType=Application\nName=Notes\nHidden=true\n");
  writeFile(userApps() / "org.example.Site.desktop", "[Desktop Entry]\nType=Link\nName=Site\nURL=https://example.org\n");
  writeFile(userApps() / "org.example.Broken.desktop", "this is not a key file\n");
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 0},
                                               {"vendor-tool", 9},
                                               {"org.example.Maps", 3},
                                               {"org.example.Notes", 5},
                                               {"org.example.Site", 7},
                                               {"org.example.Broken", 8},
                                               {"org.example.NotInstalled", 12}}));
  ASSERT_NO_FATAL_FAILURE(startDaemon());

  auto printed = updateWhitelists("now");
  EXPECT_TRUE(carries(printed, {0, 3, 9}));
  EXPECT_EQ(storedSignature(), printed);
  EXPECT_TRUE(fs::is_regular_file(assistantList()));
  EXPECT_NE(daemonLog().find("updated signature user default"), std::string::npos);
}

TEST_F(WhitelistDaemon, ResourceOfTheDataHomeWinsOverTheSharedOne) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(sharedResource(), whitelistDocument({{"org.example.Mail", 2}}));
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  EXPECT_TRUE(carries(updateWhitelists("now"), {2}));

  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 40}}));
  EXPECT_TRUE(carries(updateWhitelists("now"), {40}));
}

TEST_F(WhitelistDaemon, IfStaleRegeneratesOnlyOnceTheAssistantListIsTwoDaysOld) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 1}}));
  ASSERT_NO_FATAL_FAILURE(startDaemon());

  // No assistant list yet: stale.
  EXPECT_TRUE(carries(updateWhitelists("if-stale"), {1}));

  // A changed resource is not looked at while the list is fresh.
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 30}}));
  EXPECT_TRUE(carries(updateWhitelists("if-stale"), {1}));
  EXPECT_NE(daemonLog().find("whitelist already up-to-date"), std::string::npos);

  fs::last_write_time(assistantList(), fs::file_time_type::clock::now() - 49h);
  EXPECT_TRUE(carries(updateWhitelists("if-stale"), {30}));
}

TEST_F(WhitelistDaemon, SoonWaitsForTheConfiguredDelayAndThenAnswers) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 6}}));
  ASSERT_EQ(ctl({"defaults", "write", "vireond", "VIRWhitelistSoonDelaySeconds", "-int", "1"}).status, 0);
  ASSERT_NO_FATAL_FAILURE(startDaemon());

  auto printed = updateWhitelists("soon");
  EXPECT_TRUE(carries(printed, {6}));
  EXPECT_EQ(storedSignature(), printed);
  EXPECT_NE(daemonLog().find("update whitelists soon"), std::string::npos);
}

TEST_F(WhitelistDaemon, UnknownConditionIsRefusedByTheCommandLine) {
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  auto r = ctl({"update-whitelists", "later"});
  EXPECT_NE(r.status, 0);
  EXPECT_NE(r.err.find("later"), std::string::npos) << r.err;
}

// Application changes while the daemon runs ask for a "soon" update; the
// test preference makes "soon" one second.
class WhitelistDaemonWatchingChanges : public WhitelistDaemon {
 protected:
  void SetUp() override {
    writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
    writeFile(userResource(), whitelistDocument({{"org.example.Mail", 0},
                                                 {"org.example.Maps", 3},
                                                 {"org.example.Notes", 17},
                                                 {"org.example.Clock", 21}}));
    ASSERT_EQ(ctl({"defaults", "write", "vireond", "VIRWhitelistSoonDelaySeconds", "-int", "1"}).status, 0);
    ASSERT_NO_FATAL_FAILURE(startDaemon());
    ASSERT_TRUE(carries(updateWhitelists("now"), {0}));
  }
};

TEST_F(WhitelistDaemonWatchingChanges, DesktopFileWrittenIntoTheSharedDirectoryRegenerates) {
  writeFile(sharedApps() / "org.example.Maps.desktop", applicationEntry("Maps"));
  EXPECT_TRUE(eventuallyStores({0, 3}));
  EXPECT_NE(daemonLog().find("applications changed; whitelist update requested"), std::string::npos);
}

TEST_F(WhitelistDaemonWatchingChanges, DesktopFileRenamedIntoPlaceRegenerates) {
  writeFile(home.path() / "org.example.Notes.desktop.tmp", applicationEntry("Notes"));
  fs::rename(home.path() / "org.example.Notes.desktop.tmp", userApps() / "org.example.Notes.desktop");
  EXPECT_TRUE(eventuallyStores({0, 17}));
}

TEST_F(WhitelistDaemonWatchingChanges, RemovingTheLastWhitelistedApplicationRemovesTheSignature) {
  writeFile(userApps() / "org.example.Clock.desktop", applicationEntry("Clock"));
  ASSERT_TRUE(eventuallyStores({0, 21}));
  fs::remove(userApps() / "org.example.Mail.desktop");
  ASSERT_TRUE(eventuallyStores({21}));
  fs::remove(userApps() / "org.example.Clock.desktop");
  EXPECT_TRUE(waitUntil([&] { return !storedSignature(); }, 30s)) << daemonLog();
  EXPECT_EQ(updateWhitelists("now"), "no signature");
}

TEST_F(WhitelistDaemonWatchingChanges, DisablingAnApplicationForSearchRegenerates) {
  writeFile(userApps() / "org.example.Clock.desktop", applicationEntry("Clock"));
  ASSERT_TRUE(eventuallyStores({0, 21}));
  ASSERT_NO_FATAL_FAILURE(setPreference("vireon.scoutlume", "DisabledApplications",
                                        PropertyList::array({"org.example.Mail"})));
  EXPECT_TRUE(eventuallyStores({21}));
  EXPECT_NE(daemonLog().find("preferences changed; whitelist update requested"), std::string::npos);
}

// A resource the daemon cannot use: no signature, the key removed, a log
// line, and the daemon still serving (a good resource is used again).
struct BadResource {
  const char* name;
  std::string contents;
};

class WhitelistDaemonWithABadResource : public WhitelistDaemon,
                                        public ::testing::WithParamInterface<BadResource> {};

TEST_P(WhitelistDaemonWithABadResource, StoresNoSignatureAndKeepsServing) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 11}}));
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  ASSERT_TRUE(carries(updateWhitelists("now"), {11}));

  writeFile(userResource(), GetParam().contents);
  EXPECT_EQ(updateWhitelists("now"), "no signature");
  EXPECT_EQ(storedSignature(), std::nullopt);
  EXPECT_NE(daemonLog().find("installed app whitelist vireond/app-whitelist.json is malformed"), std::string::npos)
      << daemonLog();
  EXPECT_TRUE(daemonRunning());
  EXPECT_EQ(ctl({"status"}).status, 0);

  writeFile(userResource(), whitelistDocument({{"org.example.Mail", 12}}));
  EXPECT_TRUE(carries(updateWhitelists("now"), {12}));
}

std::string outer(const nlohmann::json& apps, const char* compression, const char* encoding) {
  return nlohmann::json{{"apps", apps}, {"compression", compression}, {"encoding", encoding}}.dump();
}

INSTANTIATE_TEST_SUITE_P(
    Documents, WhitelistDaemonWithABadResource,
    ::testing::Values(
        BadResource{"TruncatedJson", whitelistDocument({{"org.example.Mail", 11}}).substr(0, 40)},
        BadResource{"WrongCompression", outer(R"({"version":"0a1F","apps":{}})", "zip", "bitmap")},
        BadResource{"WrongEncoding", outer(R"({"version":"0a1F","apps":{}})", "RLE", "list")},
        BadResource{"AppsNotAString", outer(nlohmann::json::object(), "RLE", "bitmap")},
        BadResource{"InnerDocumentNotJson", outer("{\"version\":", "RLE", "bitmap")},
        BadResource{"InnerDocumentWithoutVersion", outer(R"({"apps":{"org.example.Mail":[{"encoding_id":1}]}})", "RLE",
                                                         "bitmap")},
        BadResource{"NotAnObject", "[1, 2, 3]"}),
    [](const ::testing::TestParamInfo<BadResource>& info) { return std::string(info.param.name); });

TEST_F(WhitelistDaemon, MissingOrEmptyResourceGivesNoSignature) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  EXPECT_EQ(updateWhitelists("now"), "no signature");
  EXPECT_NE(daemonLog().find("Could not obtain file handle for installed app whitelist"), std::string::npos);

  writeFile(userResource(), "");
  EXPECT_EQ(updateWhitelists("now"), "no signature");
  EXPECT_NE(daemonLog().find("mappedData is nil"), std::string::npos) << daemonLog();
  EXPECT_TRUE(daemonRunning());
}

TEST_F(WhitelistDaemon, NoWhitelistedApplicationInstalledGivesNoSignature) {
  writeFile(userApps() / "org.example.Mail.desktop", applicationEntry("Mail"));
  writeFile(userResource(), whitelistDocument({{"org.example.Elsewhere", 4}}));
  ASSERT_NO_FATAL_FAILURE(startDaemon());
  EXPECT_EQ(updateWhitelists("now"), "no signature");
  EXPECT_EQ(storedSignature(), std::nullopt);
  EXPECT_NE(daemonLog().find("no installed application is whitelisted"), std::string::npos);
}

}  // namespace
}  // namespace fbf::testing
