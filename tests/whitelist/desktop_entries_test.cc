#include "whitelist/desktop_entries.h"

#include "support/test_support.h"

#include <gtest/gtest.h>

#include <future>
#include <map>
#include <thread>

namespace fbf {
namespace {

std::string app(std::string extra = "") {
  return "[Desktop Entry]\nType=Application\nName=Tool\n" + extra;
}

// ---- one file ----

TEST(DesktopEntryParsing, ApplicationWithIntents) {
  auto entry = parseDesktopEntry(app("Implements=org.freedesktop.Thing;vireon.Intents;\n"));
  ASSERT_TRUE(entry);
  EXPECT_TRUE(entry->isApplication);
  EXPECT_FALSE(entry->hidden);
  EXPECT_EQ(entry->implements,
            (std::vector<std::string>{"org.freedesktop.Thing", "vireon.Intents"}));
}

TEST(DesktopEntryParsing, CommentsAndBlankLinesAreSkipped) {
  auto entry = parseDesktopEntry(
      "# a comment\n\n[Desktop Entry]\n# Type=Link\nType=Application\n\nHidden=true\n");
  ASSERT_TRUE(entry);
  EXPECT_TRUE(entry->isApplication);
  EXPECT_TRUE(entry->hidden);
}

TEST(DesktopEntryParsing, LocalisedKeysDoNotStandForThePlainOnes) {
  auto entry = parseDesktopEntry(
      "[Desktop Entry]\nType[fr]=Application\nHidden[de]=true\nImplements[de]=vireon.Intents\n");
  ASSERT_TRUE(entry);
  EXPECT_FALSE(entry->isApplication);
  EXPECT_FALSE(entry->hidden);
  EXPECT_TRUE(entry->implements.empty());
}

TEST(DesktopEntryParsing, KeysOfOtherGroupsAreIgnored) {
  auto entry = parseDesktopEntry(
      "[Desktop Entry]\nType=Link\n\n[Desktop Action "
      "open]\nType=Application\nHidden=true\nImplements=vireon.Intents\n");
  ASSERT_TRUE(entry);
  EXPECT_FALSE(entry->isApplication);
  EXPECT_FALSE(entry->hidden);
  EXPECT_TRUE(entry->implements.empty());
}

TEST(DesktopEntryParsing, EscapedSeparatorKeepsOneListElement) {
  auto entry = parseDesktopEntry(app("Implements=vireon\\;Intents;vireon\\sIntents\n"));
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->implements, (std::vector<std::string>{"vireon;Intents", "vireon Intents"}));
}

TEST(DesktopEntryParsing, InvalidHiddenValueMeansVisible) {
  auto entry = parseDesktopEntry(app("Hidden=maybe\n"));
  ASSERT_TRUE(entry);
  EXPECT_FALSE(entry->hidden);
}

TEST(DesktopEntryParsing, NotAKeyFileOrNoDesktopEntryGroup) {
  std::string error;
  EXPECT_FALSE(parseDesktopEntry("just text, no group\n", &error));
  EXPECT_FALSE(error.empty());
  error.clear();
  EXPECT_FALSE(parseDesktopEntry("[Something Else]\nType=Application\n", &error));
  EXPECT_FALSE(error.empty());
}

TEST(DesktopFileIds, NestedPathsJoinWithDashes) {
  EXPECT_EQ(desktopFileId("tool.desktop"), "tool.desktop");
  EXPECT_EQ(desktopFileId("vendor/tool.desktop"), "vendor-tool.desktop");
  EXPECT_EQ(desktopFileId("a/b/c.desktop"), "a-b-c.desktop");
}

// ---- directories ----

class DesktopEntryDirectories : public ::testing::Test {
 protected:
  DesktopEntryDirectories() {
    dirs = XdgDirectories::underRoot(temp.path());
    dirs.dataDirs = {temp.path() / "system1", temp.path() / "system2"};
  }

  void write(const fs::path& dataDir, const std::string& relative, const std::string& contents) {
    testing::writeFile(dataDir / "applications" / relative, contents);
  }

  std::map<std::string, InstalledApplication> installed() {
    DesktopEntryRegistry registry(applicationDirectories(dirs));
    std::map<std::string, InstalledApplication> byId;
    for (auto& a : registry.installedApplications()) byId.emplace(a.bundleIdentifier, a);
    return byId;
  }

  testing::TempDir temp;
  XdgDirectories dirs;
};

TEST_F(DesktopEntryDirectories, LookupOrderIsDataHomeThenDataDirs) {
  auto order = applicationDirectories(dirs);
  ASSERT_EQ(order.size(), 3u);
  EXPECT_EQ(order[0], dirs.dataHome / "applications");
  EXPECT_EQ(order[1], temp.path() / "system1" / "applications");
  EXPECT_EQ(order[2], temp.path() / "system2" / "applications");
}

TEST_F(DesktopEntryDirectories, NestedFilesGetVendorPrefixedIdentifiers) {
  write(dirs.dataHome, "vendor/tool.desktop", app());
  write(dirs.dataHome, "org.example.Mail.desktop", app());
  auto apps = installed();
  EXPECT_EQ(apps.size(), 2u);
  EXPECT_TRUE(apps.count("vendor-tool"));
  EXPECT_TRUE(apps.count("org.example.Mail"));
  EXPECT_TRUE(apps.at("vendor-tool").bundleVersion.has_value());
}

TEST_F(DesktopEntryDirectories, EarlierDirectoriesShadowLaterOnes) {
  write(dirs.dataHome, "hidden.desktop", app("Hidden=true\n"));
  write(dirs.dataDirs[0], "hidden.desktop", app());
  write(dirs.dataDirs[0], "intents.desktop", app("Implements=vireon.Intents\n"));
  write(dirs.dataDirs[1], "intents.desktop", app());
  write(dirs.dataDirs[0], "link.desktop", "[Desktop Entry]\nType=Link\nURL=https://example.org\n");
  write(dirs.dataDirs[1], "link.desktop", app());
  // A nested file with the same ID in a later directory is shadowed too.
  write(dirs.dataDirs[1], "vendor/tool.desktop", app("Implements=vireon.Intents\n"));
  write(dirs.dataDirs[0], "vendor-tool.desktop", app());

  auto apps = installed();
  EXPECT_FALSE(apps.count("hidden"));
  EXPECT_FALSE(apps.count("link"));
  ASSERT_TRUE(apps.count("intents"));
  EXPECT_TRUE(apps.at("intents").providesIntents);
  ASSERT_TRUE(apps.count("vendor-tool"));
  EXPECT_FALSE(apps.at("vendor-tool").providesIntents);
}

TEST_F(DesktopEntryDirectories, OnlyApplicationsThatAreNotHiddenCount) {
  write(dirs.dataHome, "shown.desktop", app("NoDisplay=true\n"));
  write(dirs.dataHome, "hidden.desktop", app("Hidden=true\n"));
  write(dirs.dataHome, "directory.desktop", "[Desktop Entry]\nType=Directory\nName=Games\n");
  write(dirs.dataHome, "untyped.desktop", "[Desktop Entry]\nName=No type\n");
  write(dirs.dataHome, "readme.txt", app());
  auto apps = installed();
  EXPECT_EQ(apps.size(), 1u);
  EXPECT_TRUE(apps.count("shown"));
}

TEST_F(DesktopEntryDirectories, UnreadableEntriesAreLoggedAndSkipped) {
  testing::LogCapture logs;
  write(dirs.dataHome, "broken.desktop", "\x01\x02 not a key file");
  write(dirs.dataHome, "good.desktop", app());
  auto apps = installed();
  EXPECT_EQ(apps.size(), 1u);
  EXPECT_TRUE(apps.count("good"));
  EXPECT_TRUE(logs.contains("could not read desktop entry"));
}

TEST_F(DesktopEntryDirectories, MissingDirectoriesAreNoApplications) {
  EXPECT_TRUE(installed().empty());
}

TEST_F(DesktopEntryDirectories, LinkedDirectoriesAreNotEntered) {
  write(dirs.dataHome, "real/tool.desktop", app());
  fs::create_directory_symlink(dirs.dataHome / "applications",
                               dirs.dataHome / "applications" / "loop");
  auto apps = installed();
  EXPECT_EQ(apps.size(), 1u);
  EXPECT_TRUE(apps.count("real-tool"));
}

TEST_F(DesktopEntryDirectories, AssistantQueryAnswersWithIntentsApplicationsOnAnotherThread) {
  write(dirs.dataHome, "org.vireon.Notes.desktop", app("Implements=vireon.Intents\n"));
  write(dirs.dataHome, "plain.desktop", app());
  auto registry = makeDesktopEntryAssistantRegistry(
      std::make_shared<DesktopEntryRegistry>(applicationDirectories(dirs)));

  std::promise<std::pair<std::vector<std::optional<std::string>>, std::thread::id>> answer;
  registry->queryEntitledApplications([&answer](std::vector<std::optional<std::string>> ids) {
    answer.set_value({std::move(ids), std::this_thread::get_id()});
  });
  auto [ids, thread] = answer.get_future().get();
  EXPECT_EQ(ids, (std::vector<std::optional<std::string>>{std::string("org.vireon.Notes")}));
  EXPECT_NE(thread, std::this_thread::get_id());
}

}  // namespace
}  // namespace fbf
