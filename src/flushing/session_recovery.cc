#include "flushing/session_recovery.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "flushing/cache_layout.h"
#include "platform/logging.h"

#include <nlohmann/json.hpp>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("FeedbackFlusher"); }

constexpr std::string_view kRecordName = "fbf-interrupted";

bool isPartialName(std::string_view name) { return name.starts_with(".") && name.ends_with(".partial"); }

std::optional<fs::path> recordPath(const FileManager& fm) {
  auto dir = cacheDirNoCreate(fm);
  if (!dir) return std::nullopt;
  return *dir / kRecordName;
}

void writeRecord(FileManager& fm, const std::set<std::string>& ids) {
  auto path = recordPath(fm);
  if (!path) return;
  std::error_code ec;
  if (ids.empty()) {
    fm.removeItem(*path, ec);
    return;
  }
  if (!fm.writeFileAtomically(*path, nlohmann::json(ids).dump(), ec)) {
    log().error("Cannot record interrupted sessions: {}", ec.message());
  }
}

// Removes partial upload files in one directory.
size_t removePartials(FileManager& fm, const fs::path& dir) {
  size_t removed = 0;
  auto walk = fm.enumerate(dir);
  if (!walk) return 0;
  while (auto e = walk->next()) {
    if (!e->attributes.isRegular() || !isPartialName(e->name)) continue;
    std::error_code ec;
    if (fm.removeItem(e->path, ec)) ++removed;
  }
  return removed;
}

}  // namespace

std::set<std::string> interruptedSessionIDs(const FileManager& fm) {
  std::set<std::string> ids;
  auto path = recordPath(fm);
  if (!path) return ids;
  std::error_code ec;
  auto text = fm.readFile(*path, ec);
  if (!text) return ids;
  auto json = nlohmann::json::parse(*text, nullptr, false);
  if (!json.is_array()) {
    log().error("Ignoring a malformed {}", path->string());
    return ids;
  }
  for (const auto& v : json) {
    if (v.is_string()) ids.insert(v.get<std::string>());
  }
  return ids;
}

std::vector<fs::path> poisonSessionFiles(const FileManager& fm) {
  std::vector<fs::path> out;
  auto ids = interruptedSessionIDs(fm);
  if (ids.empty()) return out;
  auto files = sessionFiles(fm);
  if (!files) return out;
  while (auto e = files->next()) {
    auto name = SessionFilename::fromString(e->name);
    if (name && name->state == SessionFileState::processing && !name->uploadPending &&
        ids.count(name->sessionIDString())) {
      out.push_back(e->path);
    }
  }
  return out;
}

RecoveryResult recoverInterruptedFiles(FileManager& fm, bool keepProcessingWithUpload) {
  RecoveryResult result;
  auto cacheDir = cacheDirNoCreate(fm);
  if (!cacheDir) return result;
  result.partialsRemoved += removePartials(fm, *cacheDir);

  const auto before = interruptedSessionIDs(fm);
  std::set<std::string> after;    // only sessions that still exist stay recorded
  std::set<std::string> present;  // every session with a file now
  if (auto files = sessionFiles(fm)) {
    while (auto e = files->next()) {
      auto name = SessionFilename::fromString(e->name);
      if (!name) continue;
      const std::string id = name->sessionIDString();
      present.insert(id);
      if (name->state != SessionFileState::processing || name->uploadPending) continue;
      bool uploadExists = false;
      for (auto format : {UploadFormat::pb, UploadFormat::json}) {
        SessionFilename upload = *name;
        upload.uploadFormat = format;
        if (fm.exists(*cacheDir / upload.uploadFilenameString())) uploadExists = true;
      }
      std::error_code ec;
      if (uploadExists) {
        if (keepProcessingWithUpload) continue;
        if (fm.removeItem(e->path, ec)) {
          ++result.processingRemoved;
          log().info("Recovered {}: its upload file holds the payload.", e->name);
        }
        continue;
      }
      if (before.count(id)) {
        ++result.poisonFiles;
        after.insert(id);
        log().warn("Session {} was interrupted twice; keeping it as it is.", e->name);
        continue;
      }
      // Recorded before the rename: a crash between the two must not earn
      // the session a third try.
      after.insert(id);
      writeRecord(fm, after);
      if (vireon_renameForStateChange(fm, e->path, SessionFileState::closed, ec)) {
        ++result.returnedToClosed;
        log().info("Recovered {}: returned to closed after an interrupted flush.", e->name);
      } else {
        log().error("Cannot return {} to closed: {}", e->name, ec.message());
      }
    }
  }
  // Sessions returned once keep their mark until they are gone.
  for (const auto& id : before) {
    if (present.count(id)) after.insert(id);
  }
  if (after != before) writeRecord(fm, after);

  if (auto custom = customFeedbackDir(fm)) {
    for (const auto& type : allCustomFeedbackDirectories()) {
      const fs::path dir = *custom / type;
      result.partialsRemoved += removePartials(fm, dir);
      auto walk = fm.enumerate(dir);
      if (!walk) continue;
      while (auto e = walk->next()) {
        if (!e->attributes.isRegular() || e->name.ends_with(FBFStrings::UploadPendingSuffix)) continue;
        fs::path upload = e->path;
        upload += std::string(FBFStrings::UploadPendingSuffix);
        std::error_code ec;
        if (fm.exists(upload) && fm.removeItem(e->path, ec)) {
          ++result.customRemoved;
          log().info("Recovered {}: its upload file holds the payload.", e->path.string());
        }
      }
    }
  }
  return result;
}

}  // namespace fbf
