// Wall-clock time for the whole daemon.
//
// Every "now" in the program comes from a Clock handed in by the composition
// root, so that tests can age files by moving a clock instead of sleeping.
// Thread-safety: implementations must be safe to call from any thread.
#pragma once

#include <chrono>
#include <optional>

namespace fbf {

using SystemTime = std::chrono::system_clock::time_point;

// Seconds since 1970 as a double, the unit dates are stored and compared in.
inline double secondsSinceEpoch(SystemTime t) {
  return std::chrono::duration<double>(t.time_since_epoch()).count();
}
inline SystemTime timeFromSeconds(double s) {
  return SystemTime(std::chrono::duration_cast<SystemTime::duration>(std::chrono::duration<double>(s)));
}
// A date read back from a file or store that others can write: nothing for a
// value that is not a number or lies beyond what a SystemTime holds (about
// 292 years either side of 1970), whose conversion would be undefined.
inline std::optional<SystemTime> timeFromStoredSeconds(double s) {
  constexpr double kLimit = 9.0e9;
  if (!(s > -kLimit && s < kLimit)) return std::nullopt;
  return timeFromSeconds(s);
}

class Clock {
 public:
  virtual ~Clock() = default;
  virtual SystemTime now() const = 0;
};

// The real wall clock.
class SystemClock final : public Clock {
 public:
  SystemTime now() const override { return std::chrono::system_clock::now(); }
};

}  // namespace fbf
