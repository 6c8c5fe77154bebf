#include "platform/files.h"

#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <cstring>
#include <mutex>
#include <random>
#include <vector>

#include "platform/context.h"
#include "platform/log.h"

namespace platform {

namespace testing {
namespace {
FaultPlan g_plan;
// Files are written from the usage service's reply thread too.
std::atomic<uint64_t> g_points{0};
}  // namespace
void SetFaultPlan(const FaultPlan& plan) {
  g_plan = plan;
  g_points = 0;
}
uint64_t FaultPointsPassed() { return g_points; }
}  // namespace testing

namespace {

// One numbered fault point. False (errno set) when the plan fails this call.
bool Pass() {
  using testing::FaultPlan;
  const uint64_t n = ++testing::g_points;
  if (testing::g_plan.kind == FaultPlan::Kind::kNone || n != testing::g_plan.at) return true;
  if (testing::g_plan.kind == FaultPlan::Kind::kCrash) raise(SIGKILL);
  errno = testing::g_plan.error;
  return false;
}

std::string ErrnoText(const std::string& what, const std::string& path, int error) {
  return what + " " + path + ": " + std::strerror(error);
}

// Keeps errno across cleanup calls that might change it.
class ErrnoKeeper {
 public:
  ErrnoKeeper() : saved_(errno) {}
  ~ErrnoKeeper() { errno = saved_; }

 private:
  int saved_;
};

void CloseKeepingErrno(int fd) {
  ErrnoKeeper keep;
  if (fd >= 0) close(fd);
}

// Gives a new file or directory the group of the deployment, when one is set.
void ApplyGroup(int fd) {
  const FileModes& modes = CurrentFileModes();
  if (modes.has_group && fchown(fd, static_cast<uid_t>(-1), modes.group) != 0)
    LogError("Cannot give a file the group %d: %s", static_cast<int>(modes.group), std::strerror(errno));
}

std::string RandomSuffix() {
  static constexpr char kChars[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  static std::mt19937_64 rng{std::random_device{}() ^ static_cast<uint64_t>(getpid())};
  static std::mutex mu;  // temp files are made from more than one thread
  std::lock_guard<std::mutex> lock(mu);
  std::string s(6, 'x');
  for (char& c : s) c = kChars[rng() % (sizeof kChars - 1)];
  return s;
}

// The components of a relative path; ".." and "." are refused so that a
// name can never climb out of the directory it is resolved in.
bool SplitComponents(std::string_view rel, std::vector<std::string>* out) {
  size_t start = 0;
  while (start <= rel.size()) {
    size_t end = rel.find('/', start);
    if (end == std::string_view::npos) end = rel.size();
    const std::string_view part = rel.substr(start, end - start);
    if (part == "." || part == "..") return false;
    if (!part.empty()) out->emplace_back(part);
    start = end + 1;
  }
  return true;
}

// Opens or creates one directory below parent without following a link.
int OpenChild(int parent, const std::string& name, bool create) {
  constexpr int kFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
  int fd = openat(parent, name.c_str(), kFlags);
  if (fd >= 0 || errno != ENOENT || !create) {
    if (fd < 0 && errno == ENOTDIR) {
      // O_NOFOLLOW on a link to a directory says ENOTDIR on some kernels.
      struct stat st;
      if (fstatat(parent, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(st.st_mode)) errno = ELOOP;
    }
    return fd;
  }
  if (!Pass()) return -1;
  if (mkdirat(parent, name.c_str(), CurrentFileModes().directory) != 0 && errno != EEXIST) return -1;
  fd = openat(parent, name.c_str(), kFlags);
  if (fd >= 0) {
    // The umask may have taken bits the deployment's group needs.
    struct stat st;
    if (fstat(fd, &st) == 0 && (st.st_mode & 07777) != CurrentFileModes().directory && st.st_uid == geteuid())
      fchmod(fd, CurrentFileModes().directory);
    ApplyGroup(fd);
  }
  return fd;
}

// Opens a directory outside the device root the ordinary way, creating it
// and its parents when asked.
int OpenPlainDirectory(const std::string& path, bool create) {
  int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd >= 0 || errno != ENOENT || !create) return fd;
  const size_t slash = path.find_last_of('/');
  const std::string parent = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
  const int parent_fd = OpenPlainDirectory(parent, true);
  if (parent_fd < 0) return -1;
  fd = OpenChild(parent_fd, path.substr(slash == std::string::npos ? 0 : slash + 1), true);
  CloseKeepingErrno(parent_fd);
  return fd;
}

}  // namespace

const FileModes& CurrentFileModes() {
  static const FileModes modes = [] {
    FileModes m;
    const std::string name = EnvOr("TALLYRUN_GROUP", "");
    if (name.empty()) return m;
    std::vector<char> buf(16384);
    struct group grp, *found = nullptr;
    if (getgrnam_r(name.c_str(), &grp, buf.data(), buf.size(), &found) != 0 || !found) {
      LogError("TALLYRUN_GROUP names no known group (%s); keeping files private to their owner", name);
      return m;
    }
    m.has_group = true;
    m.group = found->gr_gid;
    m.file = 0640;
    m.directory = 0750;
    return m;
  }();
  return modes;
}

void ApplyPrivateUmask() { umask(CurrentFileModes().has_group ? 027 : 077); }

namespace {

// Everything an open descriptor holds, up to max_bytes; closes it.
std::optional<std::string> ReadOpened(int fd, const std::string& path, int64_t max_bytes, std::string* error) {
  std::string out;
  char buf[65536];
  for (;;) {
    const ssize_t n = read(fd, buf, sizeof buf);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (error) *error = ErrnoText("cannot read", path, errno);
      close(fd);
      return std::nullopt;
    }
    if (n == 0) break;
    out.append(buf, static_cast<size_t>(n));
    if (static_cast<int64_t>(out.size()) > max_bytes) {
      if (error) *error = path + " is over " + std::to_string(max_bytes) + " bytes; not reading it";
      close(fd);
      return std::nullopt;
    }
  }
  close(fd);
  return out;
}

}  // namespace

std::optional<std::string> ReadFile(const std::string& path, std::string* error) {
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    if (error) *error = ErrnoText("cannot open", path, errno);
    return std::nullopt;
  }
  struct stat st;
  if (fstat(fd, &st) == 0 && S_ISDIR(st.st_mode)) {
    close(fd);
    if (error) *error = "cannot read " + path + ": is a directory";
    return std::nullopt;
  }
  return ReadOpened(fd, path, INT64_MAX, error);
}

std::optional<std::string> ReadRegularFile(const std::string& path, int64_t max_bytes, std::string* error) {
  // Below the root the directories are opened without following a link too.
  std::optional<Directory> dir;
  const std::string& root = Context::Current().root();
  if (path.size() > root.size() + 1 && path.compare(0, root.size(), root) == 0 && path[root.size()] == '/' &&
      root != "/") {
    const size_t slash = path.rfind('/');
    dir = Directory::Open(path.substr(0, slash), false, error);
    if (!dir) return std::nullopt;
  }
  // O_NONBLOCK: a FIFO planted at the path must not stall the reader.
  const int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
  const int fd = dir ? openat(dir->fd(), path.substr(path.rfind('/') + 1).c_str(), flags) : open(path.c_str(), flags);
  if (fd < 0) {
    if (error)
      *error = errno == ELOOP ? path + " is a symbolic link; refusing to read through it"
                              : ErrnoText("cannot open", path, errno);
    return std::nullopt;
  }
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(fd);
    if (error) *error = path + " is not a regular file; refusing to read it";
    return std::nullopt;
  }
  return ReadOpened(fd, path, max_bytes, error);
}

bool FileExists(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0;
}

std::optional<int64_t> FileSize(const std::string& path) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return std::nullopt;
  return static_cast<int64_t>(st.st_size);
}

// ---- Directory ----

std::optional<Directory> Directory::Open(const std::string& path, bool create, std::string* error) {
  auto fail = [&](int err) -> std::optional<Directory> {
    if (error) *error = ErrnoText(create ? "cannot create" : "cannot open", path, err);
    errno = err;
    return std::nullopt;
  };
  if (path.empty()) return fail(ENOENT);
  const std::string& root = Context::Current().root();
  const bool below_root = path.size() > root.size() && path.compare(0, root.size(), root) == 0 &&
                          path[root.size()] == '/' && root != "/";
  if (!below_root) {
    const int fd = OpenPlainDirectory(path, create);
    if (fd < 0) return fail(errno);
    return Directory(fd, path);
  }
  // The root itself may be a link a deployment chose; below it, nothing is.
  std::vector<std::string> parts;
  if (!SplitComponents(std::string_view(path).substr(root.size() + 1), &parts)) return fail(EINVAL);
  int fd = OpenPlainDirectory(root, create);
  if (fd < 0) return fail(errno);
  for (const std::string& part : parts) {
    const int child = OpenChild(fd, part, create);
    const int err = errno;
    close(fd);
    if (child < 0) return fail(err);
    fd = child;
  }
  return Directory(fd, path);
}

Directory::Directory(Directory&& other) noexcept : fd_(other.fd_), path_(std::move(other.path_)) { other.fd_ = -1; }

Directory& Directory::operator=(Directory&& other) noexcept {
  if (this != &other) {
    if (fd_ >= 0) close(fd_);
    fd_ = other.fd_;
    path_ = std::move(other.path_);
    other.fd_ = -1;
  }
  return *this;
}

Directory::~Directory() {
  if (fd_ >= 0) close(fd_);
}

bool Directory::WriteTemp(std::string_view stem, std::string_view bytes, mode_t mode, std::string* name,
                          std::string* error) {
  const mode_t file_mode = mode ? mode : CurrentFileModes().file;
  int fd = -1;
  std::string temp;
  for (int attempt = 0; attempt < 100 && fd < 0; ++attempt) {
    temp = "." + std::string(stem) + ".tmp." + RandomSuffix();
    if (!Pass()) break;
    fd = openat(fd_, temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, file_mode);
    if (fd < 0 && errno != EEXIST) break;
  }
  if (fd < 0) {
    if (error) *error = ErrnoText("cannot create a temporary file in", path_, errno);
    return false;
  }
  auto fail = [&](const char* what) {
    const int err = errno;
    if (error) *error = ErrnoText(what, PathOf(temp), err);
    close(fd);
    unlinkat(fd_, temp.c_str(), 0);
    errno = err;
    return false;
  };
  if (fchmod(fd, file_mode) != 0) return fail("cannot set the mode of");
  ApplyGroup(fd);
  if (!Pass()) return fail("cannot write");
  while (!bytes.empty()) {
    const ssize_t n = write(fd, bytes.data(), bytes.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return fail("cannot write");
    }
    bytes.remove_prefix(static_cast<size_t>(n));
  }
  if (!Pass() || fsync(fd) != 0) return fail("cannot sync");
  if (close(fd) != 0) {
    fd = -1;
    const int err = errno;
    unlinkat(fd_, temp.c_str(), 0);
    if (error) *error = ErrnoText("cannot close", PathOf(temp), err);
    return false;
  }
  *name = temp;
  return true;
}

bool Directory::Replace(const std::string& from, std::string_view to, std::string* error) {
  const std::string target(to);
  struct stat st;
  if (fstatat(fd_, target.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(st.st_mode)) {
    if (error) *error = PathOf(target) + " is a symbolic link; refusing to replace it";
    errno = ELOOP;
    return false;
  }
  if (!Pass() || renameat(fd_, from.c_str(), fd_, target.c_str()) != 0) {
    if (error) *error = ErrnoText("cannot rename a temporary file to", PathOf(target), errno);
    return false;
  }
  return true;
}

bool Directory::Link(const std::string& from, std::string_view to, std::string* error) {
  const std::string target(to);
  if (!Pass() || linkat(fd_, from.c_str(), fd_, target.c_str(), 0) != 0) {
    if (error) *error = ErrnoText("cannot create", PathOf(target), errno);
    return false;
  }
  return true;
}

namespace {
// Where the last whole line of an open file ends: its size when it ends in
// a newline (or is empty), else just past its last newline, 0 when it has
// none; -1 when it cannot be read.
off_t EndOfLastLine(int fd, off_t size) {
  char buf[4096];
  for (off_t end = size; end > 0;) {
    const off_t start = end > static_cast<off_t>(sizeof buf) ? end - static_cast<off_t>(sizeof buf) : 0;
    const ssize_t n = pread(fd, buf, static_cast<size_t>(end - start), start);
    if (n != end - start) return -1;
    for (ssize_t i = n; i > 0; --i)
      if (buf[i - 1] == '\n') return start + i;
    end = start;
  }
  return 0;
}
}  // namespace

namespace {
// Whether the last search_bytes of an open file hold mark.
bool TailHolds(int fd, off_t size, std::string_view mark, int64_t search_bytes) {
  const off_t start = size > search_bytes ? size - search_bytes : 0;
  std::string tail(static_cast<size_t>(size - start), '\0');
  const ssize_t n = pread(fd, tail.data(), tail.size(), start);
  return n > 0 && std::string_view(tail.data(), static_cast<size_t>(n)).find(mark) != std::string_view::npos;
}
}  // namespace

bool Directory::Append(std::string_view leaf, std::string_view bytes, std::string* error, AppendOnce* once) {
  const std::string name(leaf);
  const mode_t file_mode = CurrentFileModes().file;
  // O_NONBLOCK: a FIFO planted at the path must not stall the run. Read
  // access: the end of the file is checked for a torn line.
  const int fd = Pass() ? openat(fd_, name.c_str(), O_RDWR | O_APPEND | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC,
                                 file_mode)
                        : -1;
  if (fd < 0) {
    // ENXIO: a FIFO without a reader, or a device.
    if (error)
      *error = errno == ELOOP   ? PathOf(name) + " is a symbolic link; refusing to write through it"
               : errno == ENXIO ? PathOf(name) + " is not a regular file; refusing to write to it"
                                : ErrnoText("cannot open", PathOf(name), errno);
    return false;
  }
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(fd);
    if (error) *error = PathOf(name) + " is not a regular file; refusing to write to it";
    errno = EINVAL;
    return false;
  }
  if (st.st_size == 0 && st.st_uid == geteuid() && (st.st_mode & 07777) != file_mode) {
    fchmod(fd, file_mode);
    ApplyGroup(fd);
  }
  // A line torn by an earlier run (a disk that filled up under an older
  // version, a file edited by hand) is cut off, so that the new line does
  // not grow onto it and every line stays readable.
  const off_t whole = EndOfLastLine(fd, st.st_size);
  if (whole < 0 || (whole != st.st_size && ftruncate(fd, whole) != 0)) {
    const int err = errno;
    close(fd);
    if (error) *error = ErrnoText(whole < 0 ? "cannot read" : "cannot repair", PathOf(name), err);
    errno = err;
    return false;
  }
  if (whole != st.st_size)
    LogDefault("%s ended in %lld bytes of a torn line; they were cut off", PathOf(name),
               static_cast<long long>(st.st_size - whole));
  if (once && !once->mark.empty() && TailHolds(fd, whole, once->mark, once->search_bytes)) {
    once->present = true;
    close(fd);
    return true;
  }
  ssize_t n = -1;
  if (Pass()) {
    do n = write(fd, bytes.data(), bytes.size());
    while (n < 0 && errno == EINTR);
  }
  const int err = n < 0 ? errno : ENOSPC;
  // Whole or not at all: a short write (a full disk) is taken back.
  if (n > 0 && n != static_cast<ssize_t>(bytes.size()) && ftruncate(fd, whole) != 0)
    LogError("Cannot take back a part-written line of %s: %s", PathOf(name), std::strerror(errno));
  close(fd);
  if (n != static_cast<ssize_t>(bytes.size())) {
    if (error) *error = ErrnoText("cannot write", PathOf(name), err);
    errno = err;
    return false;
  }
  return true;
}

bool Directory::Overwrite(std::string_view leaf, std::string_view bytes, std::string* error) {
  const std::string name(leaf);
  const int fd = Pass() ? openat(fd_, name.c_str(), O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC) : -1;
  if (fd < 0) {
    if (error) *error = ErrnoText("cannot open", PathOf(name), errno);
    return false;
  }
  struct stat st;
  int err = 0;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_size < static_cast<off_t>(bytes.size())) {
    err = EFBIG;
    if (error) *error = PathOf(name) + " is not a regular file long enough to be written over";
  } else {
    size_t done = 0;
    while (done < bytes.size()) {
      const ssize_t n = Pass() ? pwrite(fd, bytes.data() + done, bytes.size() - done, static_cast<off_t>(done)) : -1;
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        err = n < 0 ? errno : ENOSPC;
        break;
      }
      done += static_cast<size_t>(n);
    }
    if (!err && (!Pass() || fdatasync(fd) != 0)) err = errno;
    if (err && error) *error = ErrnoText("cannot write over", PathOf(name), err);
  }
  close(fd);
  errno = err;
  return err == 0;
}

bool Directory::MoveTo(std::string_view leaf, const Directory& to, std::string_view new_leaf, std::string* error) {
  const std::string from(leaf), target(new_leaf);
  if (!Pass() || renameat2(fd_, from.c_str(), to.fd_, target.c_str(), RENAME_NOREPLACE) != 0) {
    if (error) *error = ErrnoText("cannot move " + PathOf(from) + " to", to.PathOf(target), errno);
    return false;
  }
  return true;
}

bool Directory::Unlink(std::string_view leaf) { return unlinkat(fd_, std::string(leaf).c_str(), 0) == 0; }

bool Directory::Sync() { return Pass() && fsync(fd_) == 0; }

// ---- whole-file helpers ----

namespace {
std::string ParentOf(const std::string& path) {
  const size_t slash = path.find_last_of('/');
  return slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
}
std::string LeafOf(const std::string& path) {
  const size_t slash = path.find_last_of('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}
}  // namespace

bool MakeDirectories(const std::string& path) { return Directory::Open(path, true, nullptr).has_value(); }

bool WriteFileAtomically(const std::string& path, std::string_view bytes, std::string* error, mode_t mode) {
  std::optional<Directory> dir = Directory::Open(ParentOf(path), true, error);
  if (!dir) return false;
  const std::string leaf = LeafOf(path);
  const mode_t file_mode = mode & 0100 ? (CurrentFileModes().file | 0100) : CurrentFileModes().file;
  std::string temp;
  if (!dir->WriteTemp(leaf, bytes, file_mode, &temp, error)) return false;
  if (!dir->Replace(temp, leaf, error)) {
    ErrnoKeeper keep;
    dir->Unlink(temp);
    return false;
  }
  if (!dir->Sync()) {
    // The new file is in place; only its durability is in doubt.
    if (error) *error = ErrnoText("cannot sync the directory of", path, errno);
    return false;
  }
  return true;
}

bool AppendToFile(const std::string& path, std::string_view bytes, std::string* error, AppendOnce* once) {
  std::optional<Directory> dir = Directory::Open(ParentOf(path), true, error);
  return dir && dir->Append(LeafOf(path), bytes, error, once);
}

ssize_t WriteToDescriptor(int fd, std::string_view bytes) {
  ssize_t n;
  do {
    n = write(fd, bytes.data(), bytes.size());
  } while (n < 0 && errno == EINTR);
  return n;
}

bool IsLeftoverTempName(std::string_view name) {
  auto six_alnum = [](std::string_view s) {
    if (s.size() != 6) return false;
    for (char c : s)
      if (!std::isalnum(static_cast<unsigned char>(c))) return false;
    return true;
  };
  const size_t at = name.rfind(".tmp.");
  if (at != std::string_view::npos && six_alnum(name.substr(at + 5))) return true;
  // Submissions of earlier versions were staged as ".submission.XXXXXX".
  constexpr std::string_view kOldSubmission = ".submission.";
  return name.substr(0, kOldSubmission.size()) == kOldSubmission && six_alnum(name.substr(kOldSubmission.size()));
}

// ---- FileLock ----

std::optional<FileLock> FileLock::Acquire(const std::string& path, Wait wait, std::string* error) {
  std::optional<Directory> dir = Directory::Open(ParentOf(path), true, error);
  if (!dir) return std::nullopt;
  const std::string leaf = LeafOf(path);
  const int fd = openat(dir->fd(), leaf.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC,
                        CurrentFileModes().file);
  if (fd < 0) {
    if (error) *error = ErrnoText("cannot open the lock file", path, errno);
    return std::nullopt;
  }
  int rc;
  do rc = flock(fd, LOCK_EX | (wait == Wait::kTry ? LOCK_NB : 0));
  while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    if (error) *error = errno == EWOULDBLOCK ? std::string() : ErrnoText("cannot lock", path, errno);
    close(fd);
    return std::nullopt;
  }
  return FileLock(fd);
}

FileLock::~FileLock() {
  if (fd_ >= 0) close(fd_);
}

}  // namespace platform
