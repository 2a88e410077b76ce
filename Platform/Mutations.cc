#include "Platform/Mutations.h"

#include <signal.h>

#include <array>
#include <atomic>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <string>

#include "Platform/UniqueFd.h"

namespace sl::mut {

namespace {

constexpr std::array<std::string_view, 12> kKindNames = {
    "create", "write", "truncate", "sync", "rename", "remove", "mkdir", "link", "xattr", "owner", "mode", "times",
};

}  // namespace

std::string_view kindName(Kind kind) { return kKindNames[static_cast<size_t>(kind)]; }

#ifdef STOWLINE_FAULT_INJECTION

namespace {

constexpr int kKill = -1;

struct ErrnoName {
  const char* name;
  int code;
};
constexpr ErrnoName kErrnoNames[] = {
    {"EIO", EIO},       {"ENOSPC", ENOSPC}, {"EACCES", EACCES},       {"EROFS", EROFS},   {"EXDEV", EXDEV},
    {"ENOTEMPTY", ENOTEMPTY}, {"EPERM", EPERM}, {"ENOENT", ENOENT}, {"EEXIST", EEXIST}, {"EDQUOT", EDQUOT},
    {"EMFILE", EMFILE}, {"ENAMETOOLONG", ENAMETOOLONG}, {"EBUSY", EBUSY}, {"EINTR", EINTR},
    {"ENOTDIR", ENOTDIR}, {"EISDIR", EISDIR}, {"ELOOP", ELOOP},   {"EINVAL", EINVAL}, {"EFBIG", EFBIG},
    {"ENOMEM", ENOMEM}, {"EAGAIN", EAGAIN}, {"EOPNOTSUPP", EOPNOTSUPP}, {"ENODATA", ENODATA}, {"ERANGE", ERANGE},
};

// What to do, at which ordinal, to which kinds of operation.
struct Plan {
  int action = 0;  // 0: nothing; kKill; or an errno value
  uint64_t ordinal = 0;
  bool onward = false;
  uint32_t kinds = ~0u;  // bit per Kind
};

bool parsePlan(std::string_view spec, Plan* plan) {
  Plan parsed;
  if (spec.empty()) {
    *plan = parsed;
    return true;
  }
  const size_t at = spec.find('@');
  if (at == std::string_view::npos) return false;
  const std::string_view action = spec.substr(0, at);
  std::string_view rest = spec.substr(at + 1);
  if (action == "kill") {
    parsed.action = kKill;
  } else {
    for (const ErrnoName& entry : kErrnoNames) {
      if (action == entry.name) parsed.action = entry.code;
    }
    if (parsed.action == 0) return false;
  }
  const auto [end, ec] = std::from_chars(rest.data(), rest.data() + rest.size(), parsed.ordinal);
  if (ec != std::errc() || parsed.ordinal == 0) return false;
  rest.remove_prefix(static_cast<size_t>(end - rest.data()));
  if (!rest.empty() && rest.front() == '+') {
    parsed.onward = true;
    rest.remove_prefix(1);
  }
  if (!rest.empty()) {
    if (rest.front() != ':') return false;
    rest.remove_prefix(1);
    // One or more names, each followed by a comma but the last: an empty
    // name anywhere ("::", "rename,", ",rename") is refused.
    parsed.kinds = 0;
    for (;;) {
      const size_t comma = rest.find(',');
      const std::string_view name = rest.substr(0, comma);
      size_t index = 0;
      while (index < kKindNames.size() && kKindNames[index] != name) ++index;
      if (index == kKindNames.size()) return false;
      parsed.kinds |= 1u << index;
      if (comma == std::string_view::npos) break;
      rest.remove_prefix(comma + 1);
    }
  }
  *plan = parsed;
  return true;
}

struct State {
  std::mutex lock;  // guards plan against setPlanForTesting
  Plan plan;
  std::atomic<uint64_t> admitted{0};  // every operation
  std::atomic<uint64_t> matched{0};   // operations of the plan's kinds
  UniqueFd trace;
};

State& state() {
  static State* const instance = [] {
    auto* s = new State;  // never destroyed: operations may run during exit
    const char* spec = ::getenv("STOWLINE_FAULT");
    if (spec && !parsePlan(spec, &s->plan)) {
      std::fprintf(stderr, "stowline: STOWLINE_FAULT=\"%s\" is not <action>@<n>[+][:<kinds>]\n", spec);
      std::abort();
    }
    if (const char* path = ::getenv("STOWLINE_FAULT_TRACE"); path && *path) {
      s->trace = UniqueFd(::open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
      if (!s->trace) {
        const int openErrno = errno;
        std::fprintf(stderr, "stowline: STOWLINE_FAULT_TRACE=\"%s\" cannot be opened: %s\n", path,
                     std::strerror(openErrno));
        std::abort();
      }
    }
    return s;
  }();
  return *instance;
}

void traceOperation(State& s, uint64_t ordinal, Kind kind, const char* what) {
  std::string line = std::to_string(ordinal);
  line += ' ';
  line += kindName(kind);
  line += ' ';
  line += what ? what : "-";
  for (char& c : line) {
    if (c == '\n') c = '?';
  }
  line += '\n';
  (void)!::write(s.trace.get(), line.data(), line.size());  // one append per line
}

}  // namespace

int admit(Kind kind, const char* what) noexcept {
  const int saved = errno;
  State& s = state();
  const uint64_t ordinal = s.admitted.fetch_add(1, std::memory_order_relaxed) + 1;
  if (s.trace) traceOperation(s, ordinal, kind, what);
  Plan plan;
  {
    std::lock_guard<std::mutex> hold(s.lock);
    plan = s.plan;
  }
  errno = saved;
  if (plan.action == 0 || !(plan.kinds & (1u << static_cast<unsigned>(kind)))) return 0;
  const uint64_t n = s.matched.fetch_add(1, std::memory_order_relaxed) + 1;
  if (n < plan.ordinal || (n > plan.ordinal && !plan.onward)) return 0;
  if (plan.action != kKill) return plan.action;
  ::kill(::getpid(), SIGKILL);
  ::_exit(137);
}

bool setPlanForTesting(std::string_view spec) {
  Plan plan;
  if (!parsePlan(spec, &plan)) return false;
  State& s = state();
  std::lock_guard<std::mutex> hold(s.lock);
  s.plan = plan;
  s.admitted.store(0);
  s.matched.store(0);
  return true;
}

uint64_t admittedCount() { return state().admitted.load(); }

uint64_t matchedCount() { return state().matched.load(); }

#endif  // STOWLINE_FAULT_INJECTION

}  // namespace sl::mut
