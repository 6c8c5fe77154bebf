#include "platform/upkeep.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/diagnostics.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {

namespace {

constexpr int kMaxDepth = 16;

// The entries of an open directory, without "." and "..".
std::vector<std::string> Names(int dir_fd) {
  std::vector<std::string> out;
  const int fd = dup(dir_fd);
  if (fd < 0) return out;
  DIR* d = fdopendir(fd);
  if (!d) {
    close(fd);
    return out;
  }
  while (struct dirent* e = readdir(d)) {
    if (std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0) out.emplace_back(e->d_name);
  }
  closedir(d);
  return out;
}

class Tidier {
 public:
  explicit Tidier(const std::string& root) : root_(root), modes_(CurrentFileModes()) {}

  void Tighten(int fd, const struct stat& st, const std::string& path) {
    if (st.st_uid != geteuid()) return;  // not ours to change
    // Keep the owner's bits (the support library stays executable) and at
    // most read (and search) for the deployment's group.
    const mode_t group_bits = modes_.has_group ? (S_ISDIR(st.st_mode) ? 0050 : 0040) : 0;
    const mode_t mode = st.st_mode & 07777;
    const mode_t wanted = mode & (0700 | group_bits);
    if (wanted != mode) {
      if (fchmod(fd, wanted) == 0)
        LogDefault("Tightened %s from %04o to %04o", path, static_cast<unsigned>(mode), static_cast<unsigned>(wanted));
      else
        LogError("Cannot tighten %s: %s", path, std::strerror(errno));
    }
    if (modes_.has_group && st.st_gid != modes_.group) {
      if (fchown(fd, static_cast<uid_t>(-1), modes_.group) == 0) LogDefault("Gave %s to the group of the deployment", path);
      else LogError("Cannot give %s to the group of the deployment: %s", path, std::strerror(errno));
    }
  }

  void Walk(int dir_fd, const std::string& path, int depth) {
    if (depth > kMaxDepth) return;
    const bool submissions = path == root_ + kSubmissionsDir;
    std::vector<std::string> names = Names(dir_fd);
    for (const std::string& name : names) {
      const std::string child = path + "/" + name;
      struct stat st;
      if (fstatat(dir_fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 || S_ISLNK(st.st_mode)) continue;
      if (S_ISREG(st.st_mode) && IsLeftoverTempName(name)) {
        if (unlinkat(dir_fd, name.c_str(), 0) == 0) LogDefault("Removed %s, left by an interrupted run", child);
        continue;
      }
      if (submissions && S_ISREG(st.st_mode) && IsOrphanDescription(dir_fd, name)) {
        if (unlinkat(dir_fd, name.c_str(), 0) == 0) LogDefault("Removed %s, a description without its log", child);
        continue;
      }
      if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) continue;  // sockets and the like keep their own modes
      const int fd = openat(dir_fd, name.c_str(),
                            O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | (S_ISDIR(st.st_mode) ? O_DIRECTORY : 0));
      if (fd < 0) continue;
      struct stat now;
      if (fstat(fd, &now) == 0 && now.st_ino == st.st_ino) {
        Tighten(fd, now, child);
        if (S_ISDIR(now.st_mode)) Walk(fd, child, depth + 1);
      }
      close(fd);
    }
  }

 private:
  // "<log>.json" whose log is gone: a run stopped between the two names.
  static bool IsOrphanDescription(int dir_fd, const std::string& name) {
    constexpr std::string_view kSuffix = ".json";
    if (name.size() <= kSuffix.size() || name.compare(name.size() - kSuffix.size(), kSuffix.size(), kSuffix) != 0)
      return false;
    const std::string log = name.substr(0, name.size() - kSuffix.size());
    struct stat st;
    return fstatat(dir_fd, log.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT;
  }

  const std::string& root_;
  const FileModes& modes_;
};

}  // namespace

void TidyRoot() {
  const std::string& root = Context::Current().root();
  // Never in a directory that is not a root: a mistaken TALLYRUN_ROOT must
  // not cost some other directory its modes or its temporary files.
  if (!CheckDeviceRoot(root).ok()) return;
  const int root_fd = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (root_fd < 0) return;
  Tidier tidier(root);
  struct stat st;
  // The root itself only when it is the job's own: a shared directory such
  // as /tmp (sticky) keeps its modes.
  if (fstat(root_fd, &st) == 0 && !(st.st_mode & S_ISVTX)) tidier.Tighten(root_fd, st, root);
  // Only what the job keeps in the root, never anything else a mistaken
  // root might hold. The code under System/ is its installer's: making a
  // writable library safe-looking here would bless whatever was written
  // into it, so it stays as it is and the loader refuses it.
  for (const char* top : {"Library", "device", "var"}) {
    const int fd = openat(root_fd, top, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) continue;
    const std::string path = root + "/" + top;
    if (fstat(fd, &st) == 0) tidier.Tighten(fd, st, path);
    tidier.Walk(fd, path, 1);
    close(fd);
  }
  close(root_fd);
}

}  // namespace platform
