#include "support/test_support.h"

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

// Guards against: preferences read once and cached, read with the wrong type or default, or losing other keys when written.
class PreferencesFiles : public ::testing::Test {
 protected:
  TestEnvironment env;
  std::shared_ptr<UserDefaults> domain(const std::string& name) { return env.preferences->defaultsForDomain(name); }
  fs::path file(const std::string& name) { return env.preferences->fileForDomain(name); }
};

TEST_F(PreferencesFiles, XmlAndBinaryFilesAreReadOnEveryUseAndWrittenBack) {
  PropertyList values = {{"FBFNoExit", true}, {"FlushFrequencyInSeconds", 3600}, {"VIRDebugParameters", "v=3"}};
  writeFile(file("vireond"), serializePropertyList(values, PropertyListFormat::xml));
  auto d = domain("vireond");
  EXPECT_TRUE(d->boolForKey("FBFNoExit"));
  EXPECT_EQ(d->integerForKey("FlushFrequencyInSeconds"), 3600);
  EXPECT_EQ(d->stringForKey("VIRDebugParameters"), "v=3");

  // Replaced behind the object's back: the next read sees it.
  values["FBFNoExit"] = false;
  writeFile(file("vireond"), serializePropertyList(values, PropertyListFormat::binary));
  EXPECT_FALSE(d->boolForKey("FBFNoExit"));
  EXPECT_EQ(d->integerForKey("FlushFrequencyInSeconds"), 3600);
  ASSERT_TRUE(d->setObject("FlushFrequencyInSeconds", -5));
  EXPECT_EQ(d->integerForKey("FlushFrequencyInSeconds"), -5) << "negative integers survive the round trip";
}

TEST_F(PreferencesFiles, MissingMalformedOrMistypedValuesReadAsDefaults) {
  const struct {
    const char* name;
    std::optional<std::string> file;
    size_t errorLines;
  } rows[] = {
      {"no file", std::nullopt, 0},
      {"wrong value types",
       serializePropertyList({{"FBFNoExit", PropertyList::array({1})}, {"FlushFrequencyInSeconds", "soon"},
                              {"VIRDebugParameters", 12}}, PropertyListFormat::xml), 0},
      {"malformed", "<?xml version=\"1.0\"?><plist><dict><key>FBFNoExit</key><true/>", 1},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    if (row.file) writeFile(file("vireond"), *row.file);
    LogCapture logs;
    auto d = domain("vireond");
    EXPECT_FALSE(d->boolForKey("FBFNoExit"));
    EXPECT_EQ(d->integerForKey("FlushFrequencyInSeconds"), 0);
    EXPECT_FALSE(d->stringForKey("VIRDebugParameters"));
    EXPECT_EQ(logs.count("Ignoring malformed preferences file"), row.errorLines);
  }
}

// Guards against: a bag read once and cached, a malformed or linked bag taken as configuration, or a mistyped value passed through.
class BagFiles : public PreferencesFiles {};

TEST_F(BagFiles, TypedAccessorsAndMissingKeysReadAnewOnEveryAccess) {
  writeFile(env.cacheDir() / "bag.plist",
            serializePropertyList({{"feedback_max_age_in_days", 2}}, PropertyListFormat::binary));
  EXPECT_EQ(env.assembly().cachedBag()->feedbackMaxAgeInDays(), 2);
  env.writeBag({{"feedback_url", "https://127.0.0.1:1/fb"},
                {"feedback_max_age_in_days", 3},
                {"max_custom_feedback_sizes", {{"UserReport", 100}, {"Crowdsourcing", "big"}, {"Usage", -1}}},
                {"vireon_feedback_format", "FeedbackV2PB"}});
  auto bag = env.assembly().cachedBag();
  ASSERT_TRUE(bag);
  EXPECT_EQ(bag->feedbackURL(), "https://127.0.0.1:1/fb");
  EXPECT_EQ(bag->feedbackMaxAgeInDays(), 3);
  EXPECT_EQ(bag->maxCustomFeedbackSizes(), (std::map<std::string, uint64_t>{{"UserReport", 100}}));
  EXPECT_EQ(bag->vireonFeedbackFormat(), "FeedbackV2PB");
  EXPECT_FALSE(bag->crowdsourcingURL());
  EXPECT_FALSE(bag->cohortsLookbackInDays());
}

TEST_F(BagFiles, AMissingMalformedNonDictionaryOrSymlinkedBagIsNoBag) {
  auto secret = env.temp.path() / "secret.plist";
  writeFile(secret, serializePropertyList({{"feedback_url", "https://evil"}}, PropertyListFormat::xml));
  const fs::path bag = env.cacheDir() / "bag.plist";
  const struct {
    const char* name;
    std::function<void()> make;
    const char* log;
  } rows[] = {
      {"missing", [] {}, ""},
      {"malformed", [&] { writeFile(bag, "garbage\x01\x02"); }, "Ignoring malformed configuration bag"},
      {"an array", [&] { writeFile(bag, serializePropertyList(PropertyList::array({1, 2}), PropertyListFormat::xml)); },
       "top level is not a dictionary"},
      {"a link", [&] { fs::create_symlink(secret, bag); }, ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fs::remove(bag);
    row.make();
    LogCapture logs;
    EXPECT_FALSE(env.assembly().cachedBag());
    if (*row.log) {
      EXPECT_TRUE(logs.contains(row.log));
    }
  }
}

// Guards against: binary property lists whose strings are not text being accepted.
// Inputs the property-list fuzzer found. A binary list's strings and keys
// may hold any character: a UTF-16 NUL aborted the process inside libplist,
// and other bytes in an ASCII string made text that could be neither written
// back nor shown as JSON. Either way the file is refused, with the reason.
TEST(PropertyListFindings, BinaryStringsThatAreNotTextAreRefused) {
  // {"kk": "abc"} as a binary list: the key object at 11-13 (marker 0x52),
  // the string object at 14-17 (marker 0x53).
  const std::string valid = std::string("bplist00\xd1\x01\x02\x52kk\x53" "abc\x08\x0b\x0e", 21) +
                            std::string("\0\0\0\0\0\0\x01\x01\0\0\0\0\0\0\0\x03\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x12", 32);
  ASSERT_EQ(parsePropertyList(valid), (PropertyList{{"kk", "abc"}}));
  const struct {
    size_t at, length;
    std::string_view object;
    std::string_view reason;
  } cases[] = {
      {14, 4, std::string_view("\x61\0\0\0", 4), "NUL"},  // a string of one UTF-16 character, U+0000
      {11, 3, std::string_view("\x61\0\0", 3), "NUL"},     // the same as the key
      {14, 4, "\x53" "a\xff" "c", "UTF-8"},
      {14, 4, "\x53\xc0\xaf" "c", "UTF-8"},  // an overlong "/"
  };
  for (const auto& c : cases) {
    std::string bytes = valid;
    bytes.replace(c.at, c.length, c.object);
    std::string error;
    EXPECT_FALSE(parsePropertyList(bytes, &error)) << c.reason;
    EXPECT_NE(error.find(c.reason), std::string::npos) << error;
  }
}

}  // namespace
}  // namespace fbf::testing
