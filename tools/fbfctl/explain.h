// `fbfctl explain [--raw] PATH`: the payload the next flush would upload for
// one session or custom feedback file of the cache directory, worked out
// here, without the daemon, by the same code the flusher runs
// (makeSessionPayload with no usage sink). Nothing is sent, renamed, counted
// or written.
//
// PATH must name a regular file owned by the user inside the cache
// directory: a session file directly in it, or a custom feedback file in
// CustomFeedback/<type>/; no symbolic link anywhere below the cache
// directory. The session format comes from the cached bag, read as the
// daemon reads it.
#pragma once

#include "fbfctl/fbfctl.h"

#include <string>
#include <vector>

namespace fbf::fbfctl {

// Without --raw: one JSON document (indented) with the file, its kind, the
// upload type, the decoded payload (as `fbfctl tee uploads` shows payloads)
// and, for sessions, what the rewrite changed. With --raw: the payload's
// bytes exactly (protobuf or JSON text, before compression). Exit status and
// error lines as for every fbfctl command.
int explain(const std::vector<std::string>& args, const Environment& env);

}  // namespace fbf::fbfctl
