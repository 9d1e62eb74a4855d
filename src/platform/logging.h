// Logging by subsystem and category.
//
// One spdlog logger per (subsystem, category), all writing through one shared
// distribution sink: to the systemd journal when stderr is connected to it
// (JOURNAL_STREAM), else to stderr. The level comes from VIREON_FBF_LOG_LEVEL
// (trace, debug, info, warn, error; default info). Messages are the system's
// fixed sentences with their placeholders filled in. Thread-safe.
#pragma once

#include <spdlog/spdlog.h>

#include <string_view>

namespace fbf::logging {

inline constexpr std::string_view kSubsystem = "vireon-fbf";
inline constexpr std::string_view kSiblingSubsystem = "vireond";

// The logger of a category, created on first use.
spdlog::logger& get(std::string_view category, std::string_view subsystem = kSubsystem);

// Reads the environment and installs the output sink. Safe to call repeatedly;
// loggers made before the call follow it.
void init();

// Extra sinks (tests capture log lines with them).
void addSink(const spdlog::sink_ptr& sink);
void removeSink(const spdlog::sink_ptr& sink);
void setLevel(spdlog::level::level_enum level);

}  // namespace fbf::logging
