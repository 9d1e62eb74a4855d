// fbf-unit-sandbox UNIT -- PROGRAM [ARG...]
//
// Runs PROGRAM under the system-call confinement the service unit asks for,
// the way systemd would apply it, for machines without a user manager (CI
// containers). It reads the unit's [Service] settings that systemd enforces
// with seccomp:
//   SystemCallFilter=       allow list, then "~" deny lists, groups expanded
//                           with `systemd-analyze syscall-filter`
//   SystemCallErrorNumber=  the errno of a refused call (EPERM, the only one used)
//   SystemCallArchitectures=native
//   RestrictAddressFamilies= socket() for other families is refused (EPERM
//                           here, EAFNOSUPPORT under systemd)
//   MemoryDenyWriteExecute= no mapping both writable and executable, no
//                           mapping made executable later
//   NoNewPrivileges=        (always set: seccomp needs it without privilege)
//   UMask=
// and execs PROGRAM. Anything it cannot apply is an error, so a test cannot
// pass under a weaker sandbox than the unit's.
#include <seccomp.h>
#include <sys/mman.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

namespace {

[[noreturn]] void die(const std::string& message) {
  std::fprintf(stderr, "fbf-unit-sandbox: %s\n", message.c_str());
  std::exit(125);
}

std::vector<std::string> words(const std::string& text) {
  std::istringstream in(text);
  std::vector<std::string> out;
  for (std::string w; in >> w;) out.push_back(w);
  return out;
}

// Key to values of the unit's [Service] section, in order of appearance.
std::multimap<std::string, std::string> serviceSettings(const std::string& unitPath) {
  std::ifstream in(unitPath);
  if (!in) die("cannot read " + unitPath);
  std::multimap<std::string, std::string> out;
  bool inService = false;
  for (std::string line; std::getline(in, line);) {
    if (line.empty() || line[0] == '#' || line[0] == ';') continue;
    if (line[0] == '[') inService = line.rfind("[Service]", 0) == 0;
    auto eq = line.find('=');
    if (inService && eq != std::string::npos) out.emplace(line.substr(0, eq), line.substr(eq + 1));
  }
  return out;
}

// Every group of `systemd-analyze syscall-filter`: its members, which may be
// system calls or other groups.
std::map<std::string, std::vector<std::string>> syscallGroups() {
  FILE* p = ::popen("systemd-analyze syscall-filter --no-pager 2>/dev/null", "r");
  if (!p) die("cannot run systemd-analyze");
  std::map<std::string, std::vector<std::string>> groups;
  std::string current;
  for (char buf[512]; std::fgets(buf, sizeof buf, p);) {
    auto w = words(buf);
    if (w.empty() || w[0][0] == '#') continue;
    if (buf[0] == '@') {  // a group's own line; indented "@..." lines are members
      current = w[0];
    } else if (!current.empty()) {
      groups[current].push_back(w[0]);
    }
  }
  if (::pclose(p) != 0 || groups.empty()) die("systemd-analyze syscall-filter gave no groups");
  return groups;
}

void expand(const std::string& entry, const std::map<std::string, std::vector<std::string>>& groups,
            std::set<std::string>& out) {
  if (entry[0] != '@') return void(out.insert(entry));
  auto it = groups.find(entry);
  if (it == groups.end()) die("unknown system call group " + entry);
  for (const auto& member : it->second) expand(member, groups, out);
}

void check(int rc, const std::string& what) {
  if (rc < 0) die(what + ": " + std::strerror(-rc));
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 4 || std::strcmp(argv[2], "--") != 0) {
    std::fprintf(stderr, "usage: fbf-unit-sandbox UNIT -- PROGRAM [ARG...]\n");
    return 2;
  }
  auto settings = serviceSettings(argv[1]);
  auto groups = syscallGroups();
  auto setting = [&](const char* key) {
    auto it = settings.find(key);
    return it == settings.end() ? std::string() : it->second;
  };

  // Allowed calls: the first non-negated list, minus every "~" list.
  std::set<std::string> allowed;
  bool haveAllowList = false;
  for (auto [it, end] = settings.equal_range("SystemCallFilter"); it != end; ++it) {
    bool deny = it->second.starts_with('~');
    std::set<std::string> entries;
    for (const auto& w : words(it->second.substr(deny ? 1 : 0))) expand(w, groups, entries);
    for (const auto& e : entries) deny ? void(allowed.erase(e)) : void(allowed.insert(e));
    haveAllowList |= !deny;
  }
  if (!haveAllowList) die("the unit has no SystemCallFilter allow list");
  if (setting("SystemCallErrorNumber") != "EPERM") die("expected SystemCallErrorNumber=EPERM");
  if (setting("SystemCallArchitectures") != "native") die("expected SystemCallArchitectures=native");
  const bool mdwe = setting("MemoryDenyWriteExecute") == "yes";
  const std::map<std::string, int> knownFamilies = {{"AF_UNIX", AF_UNIX}, {"AF_INET", AF_INET}, {"AF_INET6", AF_INET6}};
  std::vector<int> families;
  for (const auto& w : words(setting("RestrictAddressFamilies"))) {
    if (!knownFamilies.count(w)) die("unsupported address family " + w);
    families.push_back(knownFamilies.at(w));
  }
  if (auto um = setting("UMask"); !um.empty()) ::umask(static_cast<mode_t>(std::stoul(um, nullptr, 8)));

  // Anything not allowed fails with EPERM; other architectures
  // are killed (libseccomp's default for a foreign architecture).
  scmp_filter_ctx ctx = seccomp_init(SCMP_ACT_ERRNO(EPERM));
  if (!ctx) die("seccomp_init failed");
  check(seccomp_attr_set(ctx, SCMP_FLTATR_CTL_NNP, 1), "no_new_privs");

  // Calls that get conditions instead of a plain allow.
  std::set<std::string> conditional;
  if (!families.empty()) conditional.insert("socket");
  if (mdwe) conditional.insert({"mmap", "mmap2", "mprotect", "pkey_mprotect", "shmat"});

  size_t rules = 0;
  for (const auto& name : allowed) {
    int nr = seccomp_syscall_resolve_name(name.c_str());
    if (nr == __NR_SCMP_ERROR || conditional.count(name)) continue;  // not a call of this architecture
    check(seccomp_rule_add(ctx, SCMP_ACT_ALLOW, nr, 0), "allow " + name);
    ++rules;
  }
  auto allowIf = [&](const char* name, scmp_arg_cmp cmp) {
    int nr = seccomp_syscall_resolve_name(name);
    if (!allowed.count(name) || nr == __NR_SCMP_ERROR) return;
    check(seccomp_rule_add(ctx, SCMP_ACT_ALLOW, nr, 1, cmp), std::string("allow ") + name + " with a condition");
  };
  for (int family : families) allowIf("socket", SCMP_A0(SCMP_CMP_EQ, static_cast<scmp_datum_t>(family)));
  if (mdwe) {
    // Writable or executable, never both; nothing made executable later.
    for (const char* call : {"mmap", "mmap2"}) {
      allowIf(call, SCMP_A2(SCMP_CMP_MASKED_EQ, PROT_EXEC, 0));
      allowIf(call, SCMP_A2(SCMP_CMP_MASKED_EQ, PROT_WRITE, 0));
    }
    allowIf("mprotect", SCMP_A2(SCMP_CMP_MASKED_EQ, PROT_EXEC, 0));
    allowIf("pkey_mprotect", SCMP_A2(SCMP_CMP_MASKED_EQ, PROT_EXEC, 0));
    allowIf("shmat", SCMP_A2(SCMP_CMP_MASKED_EQ, SHM_EXEC, 0));
  }
  if (rules < 100) die("suspiciously few system calls allowed");
  check(seccomp_load(ctx), "seccomp_load");
  seccomp_release(ctx);
  ::execvp(argv[3], argv + 3);
  die(std::string("cannot run ") + argv[3] + ": " + std::strerror(errno));
}
