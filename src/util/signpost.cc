#include "util/signpost.h"

#include "platform/logging.h"

#include <sys/sdt.h>

#include <atomic>
#include <chrono>

namespace {

int64_t nowNanos() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

spdlog::logger& signpostLog() {
  static spdlog::logger& log = fbf::logging::get("main", fbf::logging::kSiblingSubsystem);
  return log;
}

std::atomic<int64_t> gLaunchBegin{0};
std::atomic<int64_t> gFlushBegin{0};

void endInterval(const char* name, std::atomic<int64_t>& begin) {
  int64_t b = begin.exchange(0);
  double ms = b ? (nowNanos() - b) / 1e6 : 0.0;
  signpostLog().debug("signpost end {} enableTelemetry=YES  ({:.3f} ms)", name, ms);
}

}  // namespace

extern "C" {

void vireon_signpost_launchBegin(void) {
  DTRACE_PROBE(vireon_fbf, launch_begin);
  gLaunchBegin = nowNanos();
  signpostLog().debug("signpost begin launch");
}

void vireon_signpost_launchEnd(void) {
  DTRACE_PROBE(vireon_fbf, launch_end);
  endInterval("launch", gLaunchBegin);
}

void fbf_signpost_flushBegin(void) {
  DTRACE_PROBE(vireon_fbf, flush_begin);
  gFlushBegin = nowNanos();
  signpostLog().debug("signpost begin flush");
}

void fbf_signpost_flushEnd(void) {
  DTRACE_PROBE(vireon_fbf, flush_end);
  endInterval("flush", gFlushBegin);
}

void vireon_signpost_feedbackUpload(const char* type, unsigned long fileSize, unsigned long size,
                                    unsigned long compressedSize) {
  DTRACE_PROBE4(vireon_fbf, feedback_upload, type, fileSize, size, compressedSize);
  signpostLog().debug("signpost feedbackUpload type={} fileSize={} size={} compressedSize={}", type ? type : "",
                      fileSize, size, compressedSize);
}

void vireon_signpost_contextProviderInterfaceCreate(void) {
  DTRACE_PROBE(vireon_fbf, create_context_providers);
  signpostLog().debug("signpost createContextProviders");
}

void vireon_signpost_contextProviderInterfaceDestroy(void) {
  DTRACE_PROBE(vireon_fbf, destroy_context_providers);
  signpostLog().debug("signpost destroyContextProviders");
}

}  // extern "C"

namespace fbf {

SignpostInterval::SignpostInterval(const char* name, const char* message) : name_(name), beginNanos_(nowNanos()) {
  DTRACE_PROBE1(vireon_fbf, interval_begin, name);
  signpostLog().debug("signpost begin {} {}", name, message);
}

SignpostInterval::~SignpostInterval() {
  DTRACE_PROBE1(vireon_fbf, interval_end, name_);
  signpostLog().debug("signpost end {} ({:.3f} ms)", name_, (nowNanos() - beginNanos_) / 1e6);
}

}  // namespace fbf
