#include "cohorts/random_source.h"

#include "util/lock.h"

namespace fbf {

uint64_t RandomSource::uniformBelow(uint64_t bound) {
  if (bound == 0) FBF_FATAL("uniform draw below zero");
  // Rejection keeps the draw unbiased for bounds that do not divide 2^64.
  uint64_t limit = UINT64_MAX - UINT64_MAX % bound;
  for (;;) {
    uint64_t v = next();
    if (v < limit) return v % bound;
  }
}

std::array<uint8_t, 16> RandomSource::uuidBytes() {
  std::array<uint8_t, 16> bytes{};
  for (size_t i = 0; i < 16; i += 8) {
    uint64_t v = next();
    for (size_t j = 0; j < 8; ++j) bytes[i + j] = static_cast<uint8_t>(v >> (8 * j));
  }
  bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0f) | 0x40);  // version 4
  bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3f) | 0x80);  // RFC 4122 variant
  return bytes;
}

uint64_t SystemRandomSource::next() {
  return (static_cast<uint64_t>(device_()) << 32) | static_cast<uint64_t>(device_());
}

std::shared_ptr<RandomSource> makeSystemRandomSource() { return std::make_shared<SystemRandomSource>(); }

}  // namespace fbf
