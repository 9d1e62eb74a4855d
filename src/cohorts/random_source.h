// Where the cohort code draws its randomness: the age-weighted coin of the
// scheduler and the UUIDs of the envelopes. Production draws from the
// system's random device; tests inject a seeded generator.
// Thread-safety: a source is used from one queue at a time.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <random>

namespace fbf {

class RandomSource {
 public:
  virtual ~RandomSource() = default;
  // Uniformly distributed over all 64-bit values.
  virtual uint64_t next() = 0;

  // Uniform in [0, bound); bound must be positive.
  uint64_t uniformBelow(uint64_t bound);
  // A random (version 4) UUID as its 16 bytes.
  std::array<uint8_t, 16> uuidBytes();
};

class SystemRandomSource final : public RandomSource {
 public:
  uint64_t next() override;

 private:
  std::random_device device_;
};

class SeededRandomSource final : public RandomSource {
 public:
  explicit SeededRandomSource(uint64_t seed) : engine_(seed) {}
  uint64_t next() override { return engine_(); }

 private:
  std::mt19937_64 engine_;
};

std::shared_ptr<RandomSource> makeSystemRandomSource();

}  // namespace fbf
