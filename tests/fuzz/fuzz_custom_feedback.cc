// A custom feedback file as any client may drop it into its type directory:
// any bytes (the first one picks the type) through the upload preparation.
// The upload file must inflate to exactly the file's bytes, and the digest
// header must be their SHA-512.
#include "assembly/feedback_types.h"
#include "assembly/fbf_strings.h"
#include "fuzz_check.h"
#include "platform/http_session.h"
#include "platform/logging.h"
#include "support/test_support.h"
#include "upload/upload_manager.h"
#include "upload/upload_test_util.h"

#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

namespace {

class NoNetwork final : public fbf::HttpClientSession {
 public:
  void uploadFile(fbf::HttpRequest, std::filesystem::path, fbf::HttpCompletion) override {}
  void finishTasksAndInvalidate() override {}
  void cancelAllTasks() override {}
};

struct Fixture {
  Fixture() {
    env.httpSessionFactory = [](fbf::HttpSessionConfiguration) { return std::make_shared<NoNetwork>(); };
    env.writeBag({{"feedback_url", "https://feedback.example.net/upload"},
                  {"crowdsourcing_url", "https://crowd.example.net/in"}});
    manager = std::make_unique<fbf::UploadManager>(env.assembly());
  }
  fbf::testing::TestEnvironment env;
  std::unique_ptr<fbf::UploadManager> manager;
};

Fixture& fixture() {
  static auto* f = new Fixture;  // outlives every input; never torn down
  return *f;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  // Every input rewrites files, and SQLite syncs each commit: on a disk that
  // costs seconds per input; memory-backed files cost nothing, and
  // durability is not what is tested here.
  if (::access("/dev/shm", W_OK) == 0) ::setenv("TMPDIR", "/dev/shm", 1);
  fixture();
  fbf::fuzz::removeAtExit(fixture().env.temp.path());
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const auto& types = fbf::allCustomFeedbackDirectories();
  const std::string type = types[data[0] % types.size()];
  const std::string content(reinterpret_cast<const char*>(data + 1), size - 1);

  auto& f = fixture();
  const fs::path source = f.env.cacheDir() / "CustomFeedback" / type / "report";
  fbf::testing::writeFile(source, content);
  auto request = f.manager->uploadCustomFeedback(source, type);
  FUZZ_CHECK(request.has_value(), "a readable %s file was not prepared", type.c_str());

  const std::string compressed = fbf::testing::readFile(request->fileURL);
  auto inflated = fbf::testing::inflateRawIndependently(compressed);
  FUZZ_CHECK(inflated.has_value(), "the upload file is not one raw DEFLATE stream");
  FUZZ_CHECK(*inflated == content, "the upload file inflates to other bytes (%zu, not %zu)", inflated->size(),
             content.size());
  FUZZ_CHECK(request->uncompressedSize == static_cast<int64_t>(content.size()), "uncompressed size %lld",
             static_cast<long long>(request->uncompressedSize));
  FUZZ_CHECK(request->compressedSize == static_cast<int64_t>(compressed.size()), "compressed size %lld",
             static_cast<long long>(request->compressedSize));
  FUZZ_CHECK(request->request.header(fbf::FBFStrings::HTTPHeaders::Digest) == fbf::testing::sha512Hex(content),
             "the digest header is not the SHA-512 of the file");
  std::error_code ec;
  fs::remove(request->fileURL, ec);
  fs::remove(source, ec);
  return 0;
}
