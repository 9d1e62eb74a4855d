// Performance-interval markers shared with the rest of the search service.
//
// Each marker fires a USDT probe (provider "vireon_fbf", free unless traced,
// e.g. `bpftrace -e 'usdt:build/bin/vireon-fbf:vireon_fbf:* { printf("%s\n", probe); }'`)
// and writes a debug line to the "main" category of the "vireond" subsystem;
// an interval's end line carries its duration. Callable from any thread.
#pragma once

#include <cstdint>

extern "C" {
void vireon_signpost_launchBegin(void);
void vireon_signpost_launchEnd(void);
void fbf_signpost_flushBegin(void);
void fbf_signpost_flushEnd(void);
void vireon_signpost_feedbackUpload(const char* type, unsigned long fileSize, unsigned long size,
                                    unsigned long compressedSize);
void vireon_signpost_contextProviderInterfaceCreate(void);
void vireon_signpost_contextProviderInterfaceDestroy(void);
}

namespace fbf {

// A named interval inside one component ("serialize session", "upload" ...):
// begin on construction, end (with its duration) on destruction.
class SignpostInterval {
 public:
  SignpostInterval(const char* name, const char* message = "");
  ~SignpostInterval();
  SignpostInterval(const SignpostInterval&) = delete;
  SignpostInterval& operator=(const SignpostInterval&) = delete;

 private:
  const char* name_;
  int64_t beginNanos_;
};

}  // namespace fbf
