#include "session_generator.h"
#include "support/test_support.h"

#include "assembly/feedback_types.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <regex>

namespace fbf {
namespace {

mode_t modeOf(const fs::path& p) {
  struct stat st {};
  EXPECT_EQ(::lstat(p.c_str(), &st), 0) << p;
  return st.st_mode & 07777;
}

class GeneratedCacheDirectory : public ::testing::Test {
 protected:
  testing::TempDir tmp;
  fs::path cache() const { return tmp.path() / "vireond"; }
};

TEST_F(GeneratedCacheDirectory, ClosedSessionFilesAndCustomFeedbackOfEveryTypeOwnerOnly) {
  sessiongen::GeneratorOptions options;
  options.sizeMix = sessiongen::SizeMix::small;
  sessiongen::SessionGenerator generator(options);
  const int types = static_cast<int>(allCustomFeedbackDirectories().size());
  std::string error;
  auto summary = sessiongen::writeCacheDirectory(cache(), 4, types, generator, &error);
  ASSERT_TRUE(summary) << error;

  EXPECT_EQ(modeOf(cache()), 0700u);
  const std::regex name(R"(session\.[0-9]+\.[0-9A-F]{8}-[0-9A-F]{4}-4[0-9A-F]{3}-[89AB][0-9A-F]{3}-[0-9A-F]{12}\.closed)");
  ASSERT_EQ(summary->sessionFiles.size(), 4u);
  for (const auto& path : summary->sessionFiles) {
    EXPECT_TRUE(std::regex_match(path.filename().string(), name)) << path;
    EXPECT_EQ(modeOf(path), 0600u);
    std::ifstream in(path, std::ios::binary);
    corevireon::CVClientSession session;
    ASSERT_TRUE(session.ParseFromString(std::string(std::istreambuf_iterator<char>(in), {})));
    EXPECT_GT(session.feedbacks().items_size(), 5);
  }
  for (const auto& type : allCustomFeedbackDirectories()) {
    const auto dir = cache() / "CustomFeedback" / type;
    EXPECT_EQ(modeOf(dir), 0700u) << type;
    EXPECT_EQ(std::distance(fs::directory_iterator(dir), fs::directory_iterator()), 1) << type;
  }
  for (const auto& path : summary->customFeedbackFiles) EXPECT_EQ(modeOf(path), 0600u);
}

TEST_F(GeneratedCacheDirectory, RerunWithTheSameSeedAddsFilesInsteadOfFailing) {
  for (int run = 0; run < 2; ++run) {
    sessiongen::SessionGenerator generator({});
    std::string error;
    ASSERT_TRUE(sessiongen::writeCacheDirectory(cache(), 2, 2, generator, &error)) << error;
  }
  size_t sessions = 0;
  for (const auto& e : fs::directory_iterator(cache())) sessions += e.is_regular_file() ? 1 : 0;
  EXPECT_EQ(sessions, 4u);
}

TEST(GeneratedSizes, RealisticMixHasA20KBMedianAndATailBelowTheLimit) {
  sessiongen::GeneratorOptions options;
  options.seed = 5;
  sessiongen::SessionGenerator generator(options);
  std::vector<size_t> sizes;
  for (int i = 0; i < 300; ++i) sizes.push_back(generator.nextSession().session.ByteSizeLong());
  std::sort(sizes.begin(), sizes.end());
  EXPECT_GT(sizes[150], 12'000u);
  EXPECT_LT(sizes[150], 32'000u);
  EXPECT_GT(sizes.back(), 200'000u);
  EXPECT_LE(sizes.back(), 2'097'152u);
}

}  // namespace
}  // namespace fbf
