// Recursive removal: an iterative walk over directory descriptors.
//
// Threat model. The trees removed here were left behind by applications and
// old installations; they may hold symbolic links that point anywhere, and
// something else may change them while the walk runs. So:
//  - The item named by the caller is reached through its parent directory,
//    opened by path (the caller's prefix is trusted), and its last component
//    is never followed: a link there is removed as the link.
//  - Inside the tree every call is relative to a directory descriptor:
//    fstatat(AT_SYMLINK_NOFOLLOW), openat(O_DIRECTORY|O_NOFOLLOW) and
//    unlinkat on a single name. No path is rebuilt to operate on; paths are
//    built only to report an entry to the error callback.
//  - The kind of an entry (directory or not) is read from the listing and may
//    be stale. A directory swapped for a link fails to open (ELOOP) and is
//    then unlinked as the link it now is; a file swapped for a directory
//    fails to unlink (EISDIR) and is then entered. Neither is ever followed.
//  - A parent whose descriptor was closed to save descriptors is opened again
//    through ".." of its child, and must be the very directory (st_dev,
//    st_ino) recorded when it was entered. If it is not, the tree was moved
//    while the walk ran and going on would remove entries of whatever
//    directory now holds the child: the walk stops at once.
//
// Descriptor budget. The walk is iterative, so the depth of a tree costs heap
// (one Level per directory on the way down), not stack. At most
// kMaxOpenLevels directory descriptors of the walk are open at once, plus the
// descriptor of the top item's parent and, for a moment, one more while a
// directory is listed or a parent is opened again. Each directory's entries
// are read whole into memory when it is entered, so closing its descriptor
// loses nothing: the shallowest open levels are closed as the walk goes
// deeper and opened again through ".." on the way back up.
//
// Error policy: report and go on. Each entry that cannot be removed (an
// unlink or rmdir that fails, a directory that cannot be opened or listed) is
// reported to the callback with its path, its errno readable through
// REMOVEFILE_STATE_ERRNO. REMOVEFILE_PROCEED and REMOVEFILE_SKIP go on with
// the rest of the tree; REMOVEFILE_STOP (and any answer this code does not
// know) ends the walk with -1 and that errno. Without a callback the first
// failing entry ends the walk the same way. An entry that vanished during
// the walk (ENOENT) is reported like any other failure: whether that matters
// is the caller's decision. A directory whose child could not be removed then
// fails its own rmdir with ENOTEMPTY, and that is reported too.
//
// Failures that are not about one entry end the walk with -1 and errno,
// without a callback: the top item that cannot be reached or examined (ENOENT
// when nothing stands there), and a parent that cannot be opened again or is
// not the directory it was (ESTALE, see below).
//
// Mount points: the walk never enters a file system mounted inside the tree
// (a bind mount included: mount identities are compared, not devices). The
// mount point is reported with EBUSY, what its rmdir would answer, and the
// mounted tree is left as it was. The item removefile was asked for is
// entered even when it is itself a mount point: that is the caller's choice.
//
// Parallel walk. A tree large enough to pay for it (kParallelAfterEntries
// entries listed) is walked by kWorkers threads: the caller's and threads
// started for this call only, so they carry the caller's credentials
// (including a per-thread file-system uid). A walk that meets a directory at
// most kSplitDepth levels down, while the shared queue is short, hands the
// directory to the queue as a job instead of entering it; the job is a walk
// of its own, rooted at the descriptor of the directory that holds it. That
// directory becomes an Anchor: it keeps its descriptor open and counts the
// holds on it (its own walk's, one per job handed off from it, one per child
// anchor still waiting). Its rmdir is done by whichever thread releases the
// last hold, so a directory still goes only after everything in it, and no
// thread ever waits for another to remove a subtree. Anchors exist only for
// the shallow directories and jobs are few, so the descriptors held stay
// bounded: each walk keeps at most kMaxOpenLevels, anchors at most
// kSplitDepth per job in flight. A process whose descriptor limit is below
// kParallelMinDescriptors is walked by the caller alone.
//
// The error callback is called by any of the threads, one call at a time
// (under a lock), so a callback written for the single-threaded walk works
// unchanged, context included. The order of the reports across subtrees is
// the order in which the threads meet the failures. A REMOVEFILE_STOP (or
// any failure that ends the walk) stops every thread: no callback is called
// after it, queued jobs are dropped, and removefile returns -1 with the errno
// of the first failure that stopped it.

#include "Platform/Removefile.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <new>
#include <string>
#include <string_view>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/AtomicFile.h"
#include "Platform/DirectoryEntries.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"

struct sl::removefile_state {
  removefile_callback_t callback = nullptr;
  void* context = nullptr;
  int entryErrno = 0;  // errno of the entry being reported
};

namespace sl {

// Test hook: when set, called after each directory of a recursive walk has
// been listed and before any of its entries is handled, with the directory's
// descriptor and the path reported for it. Tests use it to change the tree at
// that exact point (remove an entry, swap a directory for a link, move a
// subtree). Null outside tests; it is not declared in the header.
extern void (*removefile_test_hook_after_listing)(int dirFd, const char* path);
void (*removefile_test_hook_after_listing)(int dirFd, const char* path) = nullptr;

namespace {

constexpr size_t kMaxOpenLevels = 32;
constexpr unsigned kWorkers = 4;  // the caller's thread included
constexpr size_t kParallelAfterEntries = 512;
constexpr size_t kSplitDepth = 6;  // directories deeper than this are not handed off
constexpr size_t kQueueTarget = 2 * kWorkers;
constexpr rlim_t kParallelMinDescriptors = 1024;

// What an entry of a listing is taken to be before it is touched.
enum class Kind { kDirectory, kOther };

using Entry = DirectoryEntry;

// What the listing says an entry is; only asked when its type is known.
Kind kindOf(const Entry& entry) { return entry.type == DT_DIR ? Kind::kDirectory : Kind::kOther; }

// A step of the walk either lets it go on or ends it with -1 and errno.
enum class Step { kGoOn, kStop };

// What one attempt at an entry came to.
enum class Attempt { kDone, kWrongKind, kFailed };

// A directory whose rmdir waits for work handed to other threads.
struct Anchor {
  UniqueFd fd;               // the directory: base of the *at calls of its jobs
  std::atomic<int> holds{1};  // its own walk's, then one per job and per waiting child
  // Filled by the owning walk before it releases its hold:
  int parentFd = -1;  // the directory that holds it: the parent anchor's or the top parent's
  std::shared_ptr<Anchor> parent;  // holds a hold on it; null for the top item
  std::string name;
  std::string path;  // reported if its rmdir fails
};
using AnchorPtr = std::shared_ptr<Anchor>;

// A directory handed off: removed, contents first, by a walk of its own.
struct Job {
  AnchorPtr anchor;  // the directory that holds it, with one hold for the job
  std::string name;
  std::string path;
  size_t depth;  // levels below the top item
};

class Walk;

// What the walks of one removefile call share: the state and its callback,
// the queue of jobs and the threads, and the end of the walk.
class Shared {
 public:
  Shared(removefile_state* state, bool recursive) : state_(state), recursive_(recursive) {}
  Shared(const Shared&) = delete;
  Shared& operator=(const Shared&) = delete;
  ~Shared() { drain(); }

  bool recursive() const { return recursive_; }
  bool stopped() const { return stopped_.load(std::memory_order_acquire); }

  // Reports an entry to the callback, one call at a time. Returns kStop (and
  // stops every walk) when the callback asks for it, when there is none, or
  // when the walk is already stopped.
  Step report(const std::string& path, int err) {
    std::lock_guard<std::mutex> hold(reportLock_);
    if (stopped()) return Step::kStop;
    removefile_callback_t callback = state_ != nullptr ? state_->callback : nullptr;
    if (callback != nullptr) {
      state_->entryErrno = err;
      int answer = callback(state_, path.c_str(), state_->context);
      if (answer == REMOVEFILE_PROCEED || answer == REMOVEFILE_SKIP) return Step::kGoOn;
    }
    stop(err);
    return Step::kStop;
  }

  // Ends the walk with err; the first stop's errno is the one returned.
  void stop(int err) {
    std::lock_guard<std::mutex> hold(lock_);
    if (stopped()) return;
    stopErrno_ = err;
    stopped_.store(true, std::memory_order_release);
    wake_.notify_all();
  }

  // Counts entries listed; a walk large enough starts the other threads.
  void noteListed(size_t count) {
    if (!recursive_ || tried_) return;
    listed_ += count;
    if (listed_ >= kParallelAfterEntries) startThreads();
  }

  // Whether a directory `depth` levels below the top item goes to the queue.
  bool shouldHandOff(size_t depth) const {
    return started_ && depth <= kSplitDepth && queued_.load(std::memory_order_relaxed) < kQueueTarget;
  }

  void push(Job job) {
    std::lock_guard<std::mutex> hold(lock_);
    queue_.push_back(std::move(job));
    queued_.store(queue_.size(), std::memory_order_relaxed);
    ++inFlight_;
    wake_.notify_one();
  }

  // Releases one hold on `anchor`; the last one removes its directory, then
  // releases the hold it had on its parent, and so on up.
  Step release(AnchorPtr anchor) {
    while (anchor) {
      if (anchor->holds.fetch_sub(1, std::memory_order_acq_rel) != 1) return Step::kGoOn;
      anchor->fd.reset();  // closes the directory before its rmdir
      if (stopped()) return Step::kStop;
      if (mut::unlinkat(anchor->parentFd, anchor->name.c_str(), AT_REMOVEDIR) != 0) {
        int err = errno;
        if (report(anchor->path, err) == Step::kStop) return Step::kStop;
      }
      anchor = std::move(anchor->parent);
    }
    return Step::kGoOn;
  }

  // Runs the queued jobs on the caller's thread too, until none is left,
  // then lets the threads go. Returns 0, or -1 with the errno of the stop.
  int finish() {
    drain();
    if (!stopped()) return 0;
    errno = stopErrno_;
    return -1;
  }

 private:
  void startThreads();
  void runJob(Job job);

  // Takes a job; waits while others run and may hand off more. False when
  // none is left and none runs (or, for a thread, once drain says so).
  bool take(Job& job, bool caller) {
    std::unique_lock<std::mutex> hold(lock_);
    for (;;) {
      if (!queue_.empty()) {
        job = std::move(queue_.front());
        queue_.pop_front();
        queued_.store(queue_.size(), std::memory_order_relaxed);
        return true;
      }
      if (caller ? inFlight_ == 0 : done_) return false;
      wake_.wait(hold);
    }
  }

  void drain() {
    Job job;
    while (!threads_.empty() && take(job, true)) runJob(std::move(job));
    {
      std::lock_guard<std::mutex> hold(lock_);
      done_ = true;
      wake_.notify_all();
    }
    for (std::thread& thread : threads_) thread.join();
    threads_.clear();
  }

  removefile_state* state_;
  const bool recursive_;
  std::mutex reportLock_;  // one callback at a time; taken before lock_
  std::mutex lock_;        // the queue and the counts below
  std::condition_variable wake_;
  std::deque<Job> queue_;
  std::atomic<size_t> queued_{0};  // queue_.size(), read without the lock
  size_t inFlight_ = 0;             // jobs queued or running
  bool done_ = false;
  std::atomic<bool> stopped_{false};
  int stopErrno_ = 0;
  // Only the caller's thread touches these.
  size_t listed_ = 0;
  bool tried_ = false;
  bool started_ = false;
  std::vector<std::thread> threads_;
};

// One directory on the way down from the top item of a walk.
struct Level {
  UniqueFd fd;  // closed while the level is evicted; moved into the anchor
  dev_t dev;    // identity recorded when the directory was entered
  ino_t ino;
  std::string name;  // name in the parent directory
  std::vector<Entry> entries;
  size_t next = 0;   // first entry not yet handled
  AnchorPtr anchor;  // set once work was handed off from it

  int dirFd() const { return anchor ? anchor->fd.get() : fd.get(); }
};

class Walk {
 public:
  // A walk of the item `topName` in topParent, reported as topPath, `depth`
  // levels below the item removefile was asked for; topAnchor is the anchor
  // that holds it when it is a job.
  Walk(Shared& shared, int topParent, std::string topName, std::string topPath, size_t depth, AnchorPtr topAnchor)
      : shared_(shared),
        topPath_(std::move(topPath)),
        topParent_(topParent),
        topName_(std::move(topName)),
        depth_(depth),
        topAnchor_(std::move(topAnchor)) {}

  // Removes the top item, of the given kind. On a failure that ends the walk
  // it stops the shared walk.
  void run(Kind topKind) {
    if (runSteps(topKind) == Step::kStop) shared_.stop(errno);
  }

 private:
  Step runSteps(Kind topKind) {
    if (handleEntry(topParent_, topName_, topKind) == Step::kStop) return Step::kStop;
    while (!stack_.empty()) {
      if (shared_.stopped()) return Step::kStop;
      Level& level = stack_.back();
      if (level.next < level.entries.size()) {
        // handleEntry may push a level: work on a copy of the entry.
        Entry entry = std::move(level.entries[level.next++]);
        Step step = entry.type != DT_UNKNOWN ? handleEntry(level.dirFd(), entry.name, kindOf(entry))
                                             : handleUnknownEntry(level.dirFd(), entry.name);
        if (step == Step::kStop) return Step::kStop;
        continue;
      }
      if (finishLevel() == Step::kStop) return Step::kStop;
    }
    return Step::kGoOn;
  }

  // The path reported for stack_[depth]: the top path, then the names.
  std::string levelPath(size_t depth) const {
    std::string path = topPath_;
    for (size_t i = 1; i <= depth; ++i) {
      path += '/';
      path += stack_[i].name;
    }
    return path;
  }

  // The path reported for an entry of the deepest level (or for the top item
  // while nothing has been entered).
  std::string entryPath(const std::string& name) const {
    if (stack_.empty()) return topPath_;
    return levelPath(stack_.size() - 1) + "/" + name;
  }

  Step report(const std::string& path, int err) {
    Step step = shared_.report(path, err);
    errno = err;
    return step;
  }

  Step handleUnknownEntry(int dirFd, const std::string& name) {
    struct stat st;
    if (fstatat(dirFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
      int err = errno;
      return report(entryPath(name), err);
    }
    return handleEntry(dirFd, name, S_ISDIR(st.st_mode) ? Kind::kDirectory : Kind::kOther);
  }

  // Removes the entry `name` of dirFd, or enters it when it is a directory of
  // a recursive walk (it is then removed when its level is finished), or
  // hands it off. The kind may be stale: one change of kind is followed; a
  // second one is reported as the failure it is.
  Step handleEntry(int dirFd, const std::string& name, Kind kind) {
    if (kind == Kind::kDirectory && !stack_.empty() && shared_.shouldHandOff(depth_ + stack_.size())) {
      handOff(name);
      return Step::kGoOn;
    }
    int err = 0;
    for (int tries = 0; tries < 2; ++tries) {
      Attempt attempt = kind == Kind::kDirectory ? removeDirectory(dirFd, name, err) : removeOther(dirFd, name, err);
      if (attempt == Attempt::kDone) return Step::kGoOn;
      if (attempt == Attempt::kFailed) break;
      kind = kind == Kind::kDirectory ? Kind::kOther : Kind::kDirectory;
    }
    return report(entryPath(name), err);
  }

  // Queues the directory `name` of the deepest level as a job.
  void handOff(const std::string& name) {
    Level& level = stack_.back();
    AnchorPtr& anchor = anchorOf(level);
    anchor->holds.fetch_add(1, std::memory_order_relaxed);
    shared_.push(Job{anchor, name, entryPath(name), depth_ + stack_.size()});
  }

  // The anchor of an open level, made on first use; the level's descriptor
  // moves into it and stays open until the directory is removed.
  static AnchorPtr& anchorOf(Level& level) {
    if (!level.anchor) {
      level.anchor = std::make_shared<Anchor>();
      level.anchor->fd = std::move(level.fd);
    }
    return level.anchor;
  }

  static Attempt removeOther(int dirFd, const std::string& name, int& err) {
    if (mut::unlinkat(dirFd, name.c_str(), 0) == 0) return Attempt::kDone;
    err = errno;
    return err == EISDIR ? Attempt::kWrongKind : Attempt::kFailed;
  }

  Attempt removeDirectory(int dirFd, const std::string& name, int& err) {
    if (!shared_.recursive()) {
      if (mut::unlinkat(dirFd, name.c_str(), AT_REMOVEDIR) == 0) return Attempt::kDone;
      err = errno;
      return err == ENOTDIR ? Attempt::kWrongKind : Attempt::kFailed;
    }
    UniqueFd fd(openat(dirFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
      err = errno;
      // ELOOP: a link stands there now; ENOTDIR: some other non-directory.
      if (err == ELOOP || err == ENOTDIR) return Attempt::kWrongKind;
      return removeIfEmpty(dirFd, name);
    }
    struct stat st;
    std::vector<Entry> entries;
    if (fstat(fd.get(), &st) != 0) {
      err = errno;
      return removeIfEmpty(dirFd, name);
    }
    if (!(stack_.empty() && depth_ == 0) && isMountedOn(dirFd, fd.get())) {
      err = EBUSY;
      return Attempt::kFailed;
    }
    err = readDirectoryEntries(fd.get(), entries);
    if (err != 0) {
      fd.reset();
      return removeIfEmpty(dirFd, name);
    }
    if (depth_ == 0) shared_.noteListed(entries.size());
    stack_.push_back(Level{std::move(fd), st.st_dev, st.st_ino, name, std::move(entries), 0, nullptr});
    if (stack_.size() - lowestOpen_ > kMaxOpenLevels) {
      // An anchored level keeps its descriptor: jobs use it.
      stack_[lowestOpen_++].fd.reset();
    }
    if (removefile_test_hook_after_listing != nullptr) {
      removefile_test_hook_after_listing(stack_.back().dirFd(), levelPath(stack_.size() - 1).c_str());
    }
    return Attempt::kDone;
  }

  // True when `child` is the root of another mount than `parent`'s. When
  // the mount identity cannot be read the devices decide.
  static bool isMountedOn(int parent, int child) {
    struct statx a;
    struct statx b;
    if (statx(parent, "", AT_EMPTY_PATH, STATX_MNT_ID, &a) == 0 &&
        statx(child, "", AT_EMPTY_PATH, STATX_MNT_ID, &b) == 0 && (a.stx_mask & b.stx_mask & STATX_MNT_ID)) {
      return a.stx_mnt_id != b.stx_mnt_id;
    }
    struct stat pa;
    struct stat ch;
    return fstat(parent, &pa) == 0 && fstat(child, &ch) == 0 && pa.st_dev != ch.st_dev;
  }

  // A directory that could not be entered is still removed when it is empty
  // (its rmdir needs only the parent's permissions). When that fails too,
  // the reason it could not be entered is the one reported.
  static Attempt removeIfEmpty(int dirFd, const std::string& name) {
    return mut::unlinkat(dirFd, name.c_str(), AT_REMOVEDIR) == 0 ? Attempt::kDone : Attempt::kFailed;
  }

  // All entries of the deepest level are handled: remove the directory from
  // its parent, opening the parent again first if it was evicted. A
  // directory with jobs still out is left to the thread that ends the last.
  Step finishLevel() {
    size_t depth = stack_.size() - 1;
    int parentFd = topParent_;
    if (depth > 0) {
      Level& parent = stack_[depth - 1];
      if (!parent.fd && !parent.anchor && reopenParent(depth) == Step::kStop) return Step::kStop;
      parentFd = parent.dirFd();
    }
    if (stack_.back().anchor) return deferLevel(depth);
    std::string name = std::move(stack_.back().name);
    stack_.pop_back();  // closes the directory before its rmdir
    if (mut::unlinkat(parentFd, name.c_str(), AT_REMOVEDIR) == 0) return Step::kGoOn;
    int err = errno;
    return report(depth == 0 ? topPath_ : levelPath(depth - 1) + "/" + name, err);
  }

  // The deepest level is done with its own entries but has handed work off:
  // it waits on its parent as an anchor, and is removed on its last release.
  Step deferLevel(size_t depth) {
    AnchorPtr anchor = std::move(stack_.back().anchor);
    anchor->path = levelPath(depth);
    anchor->name = std::move(stack_.back().name);
    if (depth > 0) {
      anchor->parent = anchorOf(stack_[depth - 1]);
    } else {
      anchor->parent = topAnchor_;
    }
    anchor->parentFd = anchor->parent ? anchor->parent->fd.get() : topParent_;
    if (anchor->parent) anchor->parent->holds.fetch_add(1, std::memory_order_relaxed);
    stack_.pop_back();
    return shared_.release(std::move(anchor));
  }

  // Opens stack_[depth - 1] again through ".." of stack_[depth]. The parent
  // is needed only as the base of *at calls (its entries are in memory), so
  // O_PATH suffices and no read permission on it is needed. When ".." is not
  // the directory recorded on the way down, the tree was moved during the
  // walk: it stops with ESTALE, our record of where we came from being stale.
  // A child that the caller may not search cannot give its ".." either: the
  // walk then stops with that errno (EACCES). Only trees deeper than the
  // budget meet this, and such a child could not be emptied anyway.
  Step reopenParent(size_t depth) {
    Level& parent = stack_[depth - 1];
    UniqueFd fd(openat(stack_[depth].dirFd(), "..", O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) return Step::kStop;  // errno from openat
    struct stat st;
    if (fstat(fd.get(), &st) != 0) return Step::kStop;
    if (st.st_dev != parent.dev || st.st_ino != parent.ino) {
      errno = ESTALE;
      return Step::kStop;
    }
    parent.fd = std::move(fd);
    lowestOpen_ = depth - 1;
    return Step::kGoOn;
  }

  Shared& shared_;
  std::string topPath_;
  int topParent_;
  std::string topName_;
  size_t depth_;
  AnchorPtr topAnchor_;
  std::vector<Level> stack_;
  // Levels [lowestOpen_, stack_.size()) hold open descriptors (or anchors);
  // those below were evicted, unless anchored.
  size_t lowestOpen_ = 0;
};

void Shared::startThreads() {
  tried_ = true;
  rlimit limit;
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur < kParallelMinDescriptors) return;
  started_ = true;  // before any thread can read it
  for (unsigned i = 1; i < kWorkers; ++i) {
    try {
      threads_.emplace_back([this] {
        Job job;
        while (take(job, false)) runJob(std::move(job));
      });
    } catch (const std::system_error&) {
      break;  // the threads started so far share the work
    }
  }
  if (threads_.empty()) started_ = false;  // no other thread reads it then
}

void Shared::runJob(Job job) {
  if (!stopped()) {
    Walk walk(*this, job.anchor->fd.get(), std::move(job.name), std::move(job.path), job.depth, job.anchor);
    walk.run(Kind::kDirectory);
  }
  release(std::move(job.anchor));
  std::lock_guard<std::mutex> hold(lock_);
  if (--inFlight_ == 0) wake_.notify_all();
}

// Splits path into the directory that holds the item and the item's name,
// and checks the top item. Returns 0 and fills the outputs, or an errno.
int resolveTop(const char* path, std::string& topPath, UniqueFd& parentFd, std::string& name, Kind& kind) {
  if (path == nullptr) return EINVAL;
  std::string p(path);
  if (p.empty()) return ENOENT;
  bool trailingSlash = false;
  while (p.size() > 1 && p.back() == '/') {
    p.pop_back();
    trailingSlash = true;
  }
  if (p == "/") return EBUSY;  // what rmdir answers for the root
  size_t slash = p.rfind('/');
  std::string parent = slash == std::string::npos ? "." : slash == 0 ? "/" : p.substr(0, slash);
  name = slash == std::string::npos ? p : p.substr(slash + 1);
  // "." and ".." name a directory by a path that cannot be removed; emptying
  // it first would be a surprise. Refused, as rmdir refuses ".".
  if (name == "." || name == "..") return EINVAL;

  // The prefix is the caller's and may be followed; the last name is not.
  parentFd = UniqueFd(open(parent.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!parentFd) return errno;
  struct stat st;
  if (fstatat(parentFd.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  kind = S_ISDIR(st.st_mode) ? Kind::kDirectory : Kind::kOther;
  // "name/" asks for a directory. A link to one is not followed, so the
  // answer is the one the system gives for a non-directory with a slash.
  if (trailingSlash && kind != Kind::kDirectory) return ENOTDIR;
  topPath = std::move(p);
  return 0;
}

// True for a directory with no entries: removing it loses nothing.
bool isEmptyDirectory(int parentFd, const std::string& name, Kind kind) {
  if (kind != Kind::kDirectory) return false;
  UniqueFd fd(openat(parentFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return false;
  UniqueDir dir = fdopendir(fd);
  if (!dir) return false;
  while (const struct dirent* entry = readdir(dir.get())) {
    const std::string_view entryName = entry->d_name;
    if (entryName != "." && entryName != "..") return false;
  }
  return true;
}

// Makes a removal durable before what it freed can be used again. On a
// file system without a journal, a name that outlived a power cut would
// lead to an inode that is by then another file's, and the repair would
// make the two one (a removed container back, holding a newer file). A
// removed item's parent is flushed (noted only while flushes are
// deferred); a tree removed in part, whose changed directories may be
// anywhere in it, has its file system flushed. Returns 0 or the flush's
// errno. A parent the caller may not read cannot be flushed on Linux and
// is left as it stands.
int flushRemoval(int parentFd, const std::string& name, const std::string& topPath, Kind kind) {
  Error error;
  struct stat st;
  if (fstatat(parentFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT) {
    UniqueFd parent(openat(parentFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!parent) return errno == EACCES ? 0 : errno;
    return syncDirectoryAfterRemoval(parent.get(), topPath, &error) ? 0 : static_cast<int>(error.code());
  }
  if (kind != Kind::kDirectory) return 0;
  return syncTree(topPath, &error) ? 0 : static_cast<int>(error.code());
}

}  // namespace

removefile_state_t removefile_state_alloc() {
  auto* state = new (std::nothrow) removefile_state();
  if (state == nullptr) errno = ENOMEM;
  return state;
}

int removefile_state_free(removefile_state_t state) {
  delete state;
  return 0;
}

// The callback is passed as the function's own address converted to a data
// pointer (conditionally supported by the language, supported by every
// compiler this builds with); the context is kept as given.
int removefile_state_set(removefile_state_t state, uint32_t key, const void* value) {
  if (state == nullptr) {
    errno = EINVAL;
    return -1;
  }
  switch (key) {
    case REMOVEFILE_STATE_ERROR_CALLBACK:
      state->callback = reinterpret_cast<removefile_callback_t>(const_cast<void*>(value));
      return 0;
    case REMOVEFILE_STATE_ERROR_CONTEXT:
      state->context = const_cast<void*>(value);
      return 0;
    default:
      errno = EINVAL;
      return -1;
  }
}

int removefile_state_get(removefile_state_t state, uint32_t key, void* dst) {
  if (state == nullptr || dst == nullptr) {
    errno = EINVAL;
    return -1;
  }
  switch (key) {
    case REMOVEFILE_STATE_ERRNO:
      *static_cast<int*>(dst) = state->entryErrno;
      return 0;
    case REMOVEFILE_STATE_ERROR_CALLBACK:
      *static_cast<removefile_callback_t*>(dst) = state->callback;
      return 0;
    case REMOVEFILE_STATE_ERROR_CONTEXT:
      *static_cast<void**>(dst) = state->context;
      return 0;
    default:
      errno = EINVAL;
      return -1;
  }
}

int removefile(const char* path, removefile_state_t state, removefile_flags_t flags) {
  if (state != nullptr) state->entryErrno = 0;
  std::string topPath;
  std::string name;
  UniqueFd parentFd;
  Kind kind = Kind::kOther;
  if (int err = resolveTop(path, topPath, parentFd, name, kind); err != 0) {
    errno = err;
    return -1;
  }
  // What this thread deferred (renames out of this very tree, say) reaches
  // the disk before anything here goes.
  if (deferredSyncsPending(Pending::kBesidesRemovals) && !isEmptyDirectory(parentFd.get(), name, kind)) {
    Error flushError;
    if (!flushDeferredSyncs(&flushError)) {
      errno = static_cast<int>(flushError.code());
      return -1;
    }
  }
  int result;
  int err;
  {
    Shared shared(state, (flags & REMOVEFILE_RECURSIVE) != 0);
    Walk(shared, parentFd.get(), name, topPath, 0, nullptr).run(kind);
    result = shared.finish();
    err = errno;
  }
  // A failed removal keeps its own errno; a flush that fails after one
  // that succeeded is the call's failure.
  const int flushErrno = flushRemoval(parentFd.get(), name, topPath, kind);
  if (result == 0 && flushErrno != 0) {
    result = -1;
    err = flushErrno;
  }
  // Closing descriptors and freeing memory keep errno, but the caller must
  // read the errno of the failure whatever they do.
  errno = err;
  return result;
}

}  // namespace sl
