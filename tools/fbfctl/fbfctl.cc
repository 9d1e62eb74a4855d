#include "fbfctl/fbfctl.h"

#include "fbfctl/explain.h"
#include "fbfctl/payload_json.h"
#include "ipc/control_client.h"
#include "platform/file_manager.h"
#include "platform/user_defaults.h"
#include "util/build_info.h"

#include <charconv>
#include <cmath>
#include <ctime>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>

namespace fbf::fbfctl {
namespace {

constexpr int kFailed = 1;
constexpr int kUsage = 2;

constexpr const char* kUsageText =
    "usage: fbfctl <command> [arguments]\n"
    "\n"
    "  flush [--type NAME]               flush everything, or one custom feedback type; returns "
    "when done\n"
    "  flush-session PATH                flush one session file; returns when done\n"
    "  update-whitelists now|soon|if-stale\n"
    "                                    regenerate the app whitelist; prints the stored "
    "signature\n"
    "  tee uploads|cohorts [--count N]   print each payload as one JSON line until interrupted\n"
    "                                    (or until N payloads were printed)\n"
    "  status [--json]                   pending feedback per state and type, and the usage\n"
    "                                    cohorts (collection start, last aggregations, sentinels)\n"
    "  explain [--raw] PATH              the payload the next flush would upload for one session or\n"
    "                                    custom feedback file, with what the rewrite changed; --raw\n"
    "                                    writes its bytes (no daemon needed; sends nothing)\n"
    "  defaults read DOMAIN [KEY]\n"
    "  defaults write DOMAIN KEY [-bool|-int|-string] VALUE\n"
    "  defaults delete DOMAIN [KEY]      read and change preferences (no daemon needed)\n";

class Command {
 public:
  explicit Command(const Environment& env) : env_(env) {}

  int fail(const std::string& reason, int status = kFailed) {
    *env_.err << "fbfctl: " << reason << "\n";
    return status;
  }
  int usage(const std::string& reason) { return fail(reason + " (see fbfctl --help)", kUsage); }

  std::unique_ptr<ipc::ControlClient> connect() {
    std::string error;
    auto path = env_.dirs.socketPath();
    auto client = ipc::ControlClient::connect(path, &error);
    if (!client) fail("cannot connect to the daemon at " + path.string() + ": " + error);
    return client;
  }

  int finish(const std::string& what, const ipc::ControlOutcome& outcome) {
    if (!outcome.ok) return fail(what + " failed: " + outcome.error);
    return 0;
  }

  int flush(const std::vector<std::string>& args) {
    std::optional<std::string> type;
    for (size_t i = 0; i < args.size(); ++i) {
      if (args[i] == "--type" && i + 1 < args.size()) {
        type = args[++i];
      } else {
        return usage("flush takes only --type NAME");
      }
    }
    auto client = connect();
    if (!client) return kFailed;
    return finish("flush", type ? client->flushCustomFeedbackType(*type) : client->flush());
  }

  int flushSession(const std::vector<std::string>& args) {
    if (args.size() != 1) return usage("flush-session takes one PATH");
    std::error_code ec;
    // The daemon runs elsewhere; it is given the path as the caller sees it.
    auto path = std::filesystem::absolute(args[0], ec).lexically_normal();
    if (ec) return fail("cannot make " + args[0] + " absolute: " + ec.message());
    auto client = connect();
    if (!client) return kFailed;
    return finish("flush-session", client->flushSessionEagerly(path));
  }

  int updateWhitelists(const std::vector<std::string>& args) {
    if (args.size() != 1) return usage("update-whitelists takes one of now, soon, if-stale");
    uint64_t condition = 0;
    if (args[0] == "now") {
      condition = 0;
    } else if (args[0] == "soon") {
      condition = 1;
    } else if (args[0] == "if-stale") {
      condition = 2;
    } else {
      return usage("update-whitelists takes one of now, soon, if-stale, not " + args[0]);
    }
    auto client = connect();
    if (!client) return kFailed;
    auto outcome = client->updateWhitelists(condition);
    if (!outcome.ok) return finish("update-whitelists", outcome);
    *env_.out << outcome.whitelistSignature.value_or("no signature") << "\n";
    return 0;
  }

  int tee(const std::vector<std::string>& args) {
    if (args.empty() || (args[0] != "uploads" && args[0] != "cohorts"))
      return usage("tee takes uploads or cohorts");
    std::optional<uint64_t> count;
    for (size_t i = 1; i < args.size(); ++i) {
      if (args[i] == "--count" && i + 1 < args.size()) {
        count = parseUnsigned(args[++i]);
        if (!count || *count == 0) return usage("--count takes a positive number");
      } else {
        return usage("tee takes only --count N after the kind");
      }
    }
    auto kind = args[0] == "uploads" ? ipc::ControlClient::TeeKind::uploads
                                     : ipc::ControlClient::TeeKind::cohorts;
    auto client = connect();
    if (!client) return kFailed;
    uint64_t printed = 0;
    auto outcome = client->tee(
        kind,
        // Scripts wait for this line before they start the work they watch.
        [&] { *env_.err << "fbfctl: listening for " << args[0] << std::endl; },
        [&](const ipc::DaemonMessage& message) {
          uint64_t missed = message.has_willuploaddata() ? message.willuploaddata().missedbefore()
                            : message.has_willgeneratecohortfeebacks()
                                ? message.willgeneratecohortfeebacks().missedbefore()
                                : 0;
          // Payloads the daemon dropped for this subscriber while it lagged.
          if (missed) *env_.out << nlohmann::ordered_json{{"missed", missed}}.dump() << std::endl;
          if (message.has_willuploaddata()) {
            *env_.out << describeUpload(message.willuploaddata().data(),
                                        message.willuploaddata().format())
                             .dump()
                      << std::endl;
          } else if (message.has_willgeneratecohortfeebacks()) {
            *env_.out << describeCohortFeedback(message.willgeneratecohortfeebacks().data()).dump()
                      << std::endl;
          } else {
            return true;
          }
          return !count || ++printed < *count;
        });
    return finish("tee", outcome);
  }

  int status(const std::vector<std::string>& args) {
    bool json = false;
    for (const auto& a : args) {
      if (a == "--json") {
        json = true;
      } else {
        return usage("status takes only --json");
      }
    }
    auto client = connect();
    if (!client) return kFailed;
    std::string error;
    auto reply = client->status(&error);
    if (!reply) return fail("status failed: " + error);
    if (json) {
      *env_.out << statusJson(*reply).dump() << "\n";
    } else {
      printStatus(*reply);
    }
    return 0;
  }

  int defaults(const std::vector<std::string>& args) {
    if (args.size() < 2) return usage("defaults takes read, write or delete and a DOMAIN");
    const std::string& verb = args[0];
    const std::string& domain = args[1];
    if (domain.empty() || domain.find('/') != std::string::npos || domain == "." ||
        domain == "..") {
      return usage("invalid domain name: " + domain);
    }
    auto fileManager = makePosixFileManager(env_.dirs);
    auto store = makePlistPreferencesStore(env_.dirs.preferencesDir(), *fileManager);
    auto defaults = store->defaultsForDomain(domain);

    if (verb == "read") {
      if (args.size() == 2) {
        *env_.out << defaults->dictionaryRepresentation().dump(2) << "\n";
        return 0;
      }
      if (args.size() != 3) return usage("defaults read takes DOMAIN [KEY]");
      auto value = defaults->objectForKey(args[2]);
      if (!value) return fail("no value for " + args[2] + " in domain " + domain);
      *env_.out << (value->is_string() ? value->get<std::string>() : value->dump()) << "\n";
      return 0;
    }
    if (verb == "write") {
      if (args.size() != 4 && args.size() != 5)
        return usage("defaults write takes DOMAIN KEY [-bool|-int|-string] VALUE");
      const std::string& key = args[2];
      std::string type = args.size() == 5 ? args[3] : "-string";
      const std::string& text = args.back();
      PropertyList value;
      if (type == "-string") {
        value = text;
      } else if (type == "-bool") {
        if (text == "true" || text == "yes" || text == "YES" || text == "1") {
          value = true;
        } else if (text == "false" || text == "no" || text == "NO" || text == "0") {
          value = false;
        } else {
          return usage("-bool takes true or false, not " + text);
        }
      } else if (type == "-int") {
        int64_t n = 0;
        auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), n);
        if (ec != std::errc() || end != text.data() + text.size())
          return usage("-int takes an integer, not " + text);
        value = n;
      } else {
        return usage("unknown value type " + type);
      }
      if (!defaults->setObject(key, value))
        return fail("cannot write " + store->fileForDomain(domain).string());
      return 0;
    }
    if (verb == "delete") {
      if (args.size() == 2) {
        if (!defaults->removeDomain())
          return fail("cannot write " + store->fileForDomain(domain).string());
        return 0;
      }
      if (args.size() != 3) return usage("defaults delete takes DOMAIN [KEY]");
      if (!defaults->objectForKey(args[2]))
        return fail("no value for " + args[2] + " in domain " + domain);
      if (!defaults->removeObject(args[2]))
        return fail("cannot write " + store->fileForDomain(domain).string());
      return 0;
    }
    return usage("defaults takes read, write or delete, not " + verb);
  }

 private:
  static std::optional<uint64_t> parseUnsigned(const std::string& text) {
    uint64_t n = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), n);
    if (ec != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return n;
  }

  static nlohmann::ordered_json pendingJson(
      const google::protobuf::RepeatedPtrField<ipc::PendingFiles>& list) {
    auto out = nlohmann::ordered_json::array();
    for (const auto& p : list) {
      nlohmann::ordered_json item;
      item["name"] = p.name();
      item["files"] = p.files();
      item["bytes"] = p.bytes();
      if (p.has_oldestageseconds()) item["oldestAgeSeconds"] = p.oldestageseconds();
      out.push_back(std::move(item));
    }
    return out;
  }

  static nlohmann::ordered_json statusJson(const ipc::StatusReply& reply) {
    nlohmann::ordered_json out;
    out["version"] = reply.version();
    out["pid"] = reply.pid();
    out["sessions"] = pendingJson(reply.sessions());
    out["customFeedback"] = pendingJson(reply.customfeedback());
    out["uploadsListener"] = reply.uploadslistener();
    out["cohortsListener"] = reply.cohortslistener();
    out["cohorts"] = cohortsJson(reply);
    auto losses = nlohmann::ordered_json::array();
    for (const auto& l : reply.losseslast7days()) {
      nlohmann::ordered_json item;
      item["type"] = l.type();
      item["reason"] = l.reason();
      item["reasonCode"] = l.reasoncode();
      item["files"] = l.files();
      losses.push_back(std::move(item));
    }
    out["lossesLast7Days"] = std::move(losses);
    out["poisonFiles"] = nlohmann::ordered_json(std::vector<std::string>(reply.poisonfiles().begin(), reply.poisonfiles().end()));
    return out;
  }

  static bool hasCohorts(const ipc::StatusReply& reply) {
    return reply.has_cohortscollectionstart() || !reply.cohortslastaggregations().empty() ||
           !reply.cohortssentinels().empty();
  }

  // Null while the daemon has no readable usage store.
  static nlohmann::ordered_json cohortsJson(const ipc::StatusReply& reply) {
    if (!hasCohorts(reply)) return nullptr;
    nlohmann::ordered_json out;
    out["collectionStart"] =
        reply.has_cohortscollectionstart() ? nlohmann::ordered_json(reply.cohortscollectionstart()) : nullptr;
    auto aggregations = nlohmann::ordered_json::object();
    for (const auto& a : reply.cohortslastaggregations()) aggregations[a.frequency()] = a.timestamp();
    out["lastAggregations"] = std::move(aggregations);
    auto sentinels = nlohmann::ordered_json::array();
    for (const auto& c : reply.cohortssentinels()) {
      nlohmann::ordered_json item;
      item["client"] = c.client();
      item["count"] = c.count();
      sentinels.push_back(std::move(item));
    }
    out["sentinels"] = std::move(sentinels);
    return out;
  }

  // UTC, to the second: "2024-03-31T22:00:00Z".
  static std::string describeDate(double secondsSince1970) {
    auto t = static_cast<std::time_t>(std::floor(secondsSince1970));
    std::tm tm{};
    if (gmtime_r(&t, &tm) == nullptr) return std::to_string(secondsSince1970);
    char text[32];
    std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &tm);
    return text;
  }

  static std::string describeClient(int32_t client) {
    switch (client) {
      case 1:
        return "browser (1)";
      case 2:
        return "system search (2)";
      case 3:
        return "messages (3)";
      case 4:
        return "news (4)";
      default:
        return "client " + std::to_string(client);
    }
  }

  void printCohorts(const ipc::StatusReply& reply) {
    if (!hasCohorts(reply)) {
      *env_.out << "cohorts: no usage store\n";
      return;
    }
    *env_.out << "cohorts:\n  collecting since: "
              << (reply.has_cohortscollectionstart() ? describeDate(reply.cohortscollectionstart()) : "unknown")
              << "\n  last aggregation:";
    if (reply.cohortslastaggregations().empty()) *env_.out << " none";
    for (const auto& a : reply.cohortslastaggregations()) {
      *env_.out << "\n    " << a.frequency() << ": " << describeDate(a.timestamp());
    }
    *env_.out << "\n  session sentinels:";
    if (reply.cohortssentinels().empty()) *env_.out << " none";
    for (const auto& c : reply.cohortssentinels()) {
      *env_.out << "\n    " << describeClient(c.client()) << ": " << c.count();
    }
    *env_.out << "\n";
  }

  static std::string describeAge(int64_t seconds) {
    if (seconds < 120) return std::to_string(seconds) + " s";
    if (seconds < 7200) return std::to_string(seconds / 60) + " min";
    if (seconds < 172800) return std::to_string(seconds / 3600) + " h";
    return std::to_string(seconds / 86400) + " days";
  }

  void printPending(const char* title,
                    const google::protobuf::RepeatedPtrField<ipc::PendingFiles>& list) {
    *env_.out << title << ":";
    bool any = false;
    for (const auto& p : list) {
      if (p.files() == 0) continue;
      any = true;
      *env_.out << "\n  " << p.name() << ": " << p.files()
                << (p.files() == 1 ? " file, " : " files, ") << p.bytes() << " bytes";
      if (p.has_oldestageseconds()) *env_.out << ", oldest " << describeAge(p.oldestageseconds());
    }
    *env_.out << (any ? "\n" : " none\n");
  }

  void printStatus(const ipc::StatusReply& reply) {
    *env_.out << "daemon: " << reply.version() << " (PID " << reply.pid() << ")\n";
    printPending("sessions", reply.sessions());
    printPending("custom feedback", reply.customfeedback());
    *env_.out << "uploads listener: " << (reply.uploadslistener() ? "yes" : "no")
              << "\ncohorts listener: " << (reply.cohortslistener() ? "yes" : "no") << "\n";
    printCohorts(reply);
    *env_.out << "deletions in the last 7 days:";
    if (reply.losseslast7days().empty()) *env_.out << " none";
    *env_.out << "\n";
    for (const auto& l : reply.losseslast7days()) {
      *env_.out << "  " << l.type() << " " << l.reason() << ": " << l.files() << "\n";
    }
    *env_.out << "poison files (interrupted twice, kept as they are):";
    if (reply.poisonfiles().empty()) *env_.out << " none";
    *env_.out << "\n";
    for (const auto& f : reply.poisonfiles()) *env_.out << "  " << f << "\n";
  }

  const Environment& env_;
};

}  // namespace

int run(const std::vector<std::string>& args, const Environment& env) {
  Command command(env);
  if (args.empty()) return command.usage("missing command");
  const std::string& name = args[0];
  std::vector<std::string> rest(args.begin() + 1, args.end());
  if (name == "--help" || name == "-h" || name == "help") {
    *env.out << kUsageText;
    return 0;
  }
  if (name == "--version") {
    *env.out << "fbfctl (" << kDaemonNameAndVersion << ")\n";
    return 0;
  }
  if (name == "flush") return command.flush(rest);
  if (name == "flush-session") return command.flushSession(rest);
  if (name == "update-whitelists") return command.updateWhitelists(rest);
  if (name == "tee") return command.tee(rest);
  if (name == "status") return command.status(rest);
  if (name == "defaults") return command.defaults(rest);
  if (name == "explain") return explain(rest, env);
  return command.usage("unknown command " + name);
}

}  // namespace fbf::fbfctl
