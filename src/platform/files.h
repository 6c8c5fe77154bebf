// The file layer behind the seam. Every file the job writes goes through
// here, so that all of them are:
// - private: files 0600 and directories 0700 whatever the umask, or 0640 and
//   0750 with the group TALLYRUN_GROUP names;
// - never reached through a symbolic link: below the device root each
//   directory is opened without following links, and the file itself with
//   O_NOFOLLOW, so nothing is written outside the root;
// - crash-safe: a replaced file is the old one or the new one, never a mix,
//   and temporary files carry a name that the next run recognises and removes;
// - open to fault injection: tests can fail any write, fsync, rename or link
//   with a chosen errno, or stop the process at the N-th such call.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

// ---- reading ----

// The whole file, or nothing when it cannot be read (reason in *error).
std::optional<std::string> ReadFile(const std::string& path, std::string* error = nullptr);
// The same for a file the job keeps for itself: only a regular file (not a
// link, FIFO or device) of at most max_bytes, reached below the root through
// no link.
std::optional<std::string> ReadRegularFile(const std::string& path, int64_t max_bytes, std::string* error = nullptr);
bool FileExists(const std::string& path);
// The size of a file in bytes (stat), or nothing when it cannot be stat'ed.
std::optional<int64_t> FileSize(const std::string& path);

// ---- who may read what the job creates ----

struct FileModes {
  mode_t file = 0600;
  mode_t directory = 0700;
  bool has_group = false;
  gid_t group = 0;
};
// From TALLYRUN_GROUP (a group name), read once per process. An unknown
// group is logged once and ignored.
const FileModes& CurrentFileModes();
// Sets the process umask to match CurrentFileModes, so that files made by
// libraries (the store's journal, the socket) are private from birth too.
void ApplyPrivateUmask();

// ---- writing ----

// Creates the directory and its parents with private modes. True when it
// exists; otherwise errno says why (ENOTDIR when a file stands in the way,
// ELOOP when a link stands there below the root).
bool MakeDirectories(const std::string& path);

// For a line that must be in a file once: it is not appended when the last
// search_bytes of the file hold mark (a text only that line carries), and
// present says so.
struct AppendOnce {
  std::string_view mark;
  int64_t search_bytes = int64_t{8} << 20;
  bool present = false;
};

// A directory opened for the *at calls. Below the device root it was reached
// without following any link.
class Directory {
 public:
  // Opens (creating missing parts when create is set) the directory at path.
  static std::optional<Directory> Open(const std::string& path, bool create, std::string* error);
  Directory(Directory&& other) noexcept;
  Directory& operator=(Directory&& other) noexcept;
  ~Directory();

  int fd() const { return fd_; }
  const std::string& path() const { return path_; }
  std::string PathOf(std::string_view leaf) const { return path_ + "/" + std::string(leaf); }

  // A new file named ".<stem>.tmp.XXXXXX" holding bytes, fsynced. Its name
  // goes to *name. False (nothing left behind) on failure.
  bool WriteTemp(std::string_view stem, std::string_view bytes, mode_t mode, std::string* name, std::string* error);
  // Gives the file at from the name to, replacing what is there; a symbolic
  // link at to is refused.
  bool Replace(const std::string& from, std::string_view to, std::string* error);
  // Gives the file at from the extra name to; fails with EEXIST rather than
  // replace anything.
  bool Link(const std::string& from, std::string_view to, std::string* error);
  // Appends a line (bytes ending in a newline) whole or not at all, with one
  // write, creating the file (private) when missing: a short write is cut
  // back off, and a torn line found at the end of the file is cut off (and
  // logged) first. A symbolic link at leaf is refused.
  bool Append(std::string_view leaf, std::string_view bytes, std::string* error, AppendOnce* once = nullptr);
  // Writes bytes over the start of the existing regular file leaf, which
  // must be at least as long, and syncs it: no block is allocated, so it
  // works on a full disk where a replacement cannot. Not atomic: only for a
  // file whose reader tells a torn one from a whole one.
  bool Overwrite(std::string_view leaf, std::string_view bytes, std::string* error);
  // Moves leaf into the directory to under the name new_leaf; fails with
  // EEXIST rather than replace anything.
  bool MoveTo(std::string_view leaf, const Directory& to, std::string_view new_leaf, std::string* error);
  bool Unlink(std::string_view leaf);
  // Makes the directory's entries durable.
  bool Sync();

 private:
  Directory(int fd, std::string path) : fd_(fd), path_(std::move(path)) {}
  int fd_ = -1;
  std::string path_;
};

// Replaces path with bytes so that a reader sees the old file or the new one,
// never a mix: temp file in the same directory, fsync, rename, fsync of the
// directory. Creates missing parent directories. On failure the old file is
// untouched and no temp file is left behind. mode 0 means the private file
// mode; an executable mode keeps the owner's execute bit.
bool WriteFileAtomically(const std::string& path, std::string_view bytes, std::string* error = nullptr,
                         mode_t mode = 0);
// Appends a line to path, whole or not at all (see Directory::Append).
bool AppendToFile(const std::string& path, std::string_view bytes, std::string* error = nullptr,
                  AppendOnce* once = nullptr);

// One write(2) of bytes to an open descriptor, again after an interruption:
// the count written, or -1 with errno set.
ssize_t WriteToDescriptor(int fd, std::string_view bytes);

// True for the names of the temporary files this layer makes (and of those
// older versions made); the next run removes them.
bool IsLeftoverTempName(std::string_view name);

// An exclusive lock on a file, held until the object goes away.
class FileLock {
 public:
  enum class Wait { kBlock, kTry };
  // Nothing when the lock is held elsewhere (kTry) or the file cannot be
  // opened (reason in *error; empty when only busy).
  static std::optional<FileLock> Acquire(const std::string& path, Wait wait, std::string* error);
  FileLock(FileLock&& other) noexcept : fd_(other.fd_) { other.fd_ = -1; }
  FileLock& operator=(FileLock&&) = delete;
  ~FileLock();

 private:
  explicit FileLock(int fd) : fd_(fd) {}
  int fd_;
};

namespace testing {
// Fault injection. Every write, fsync, rename, link, mkdir or create of this
// layer is one numbered point (from 1). At point `at` the plan either kills
// the process (SIGKILL, as a power cut would) or makes that call fail with
// `error`. Only test programs install a plan.
struct FaultPlan {
  enum class Kind { kNone, kCrash, kFail };
  Kind kind = Kind::kNone;
  uint64_t at = 0;
  int error = 0;
};
void SetFaultPlan(const FaultPlan& plan);
// How many points this process has passed.
uint64_t FaultPointsPassed();
}  // namespace testing

}  // namespace platform
