#include "platform/files.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>

namespace platform {

namespace testing {
void (*g_before_rename_hook)(const std::string& temp_path) = nullptr;
}

namespace {
std::string ErrnoText(const std::string& what, const std::string& path) {
  return what + " " + path + ": " + std::strerror(errno);
}
}  // namespace

std::optional<std::string> ReadFile(const std::string& path, std::string* error) {
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    if (error) *error = ErrnoText("cannot open", path);
    return std::nullopt;
  }
  struct stat st;
  if (fstat(fd, &st) == 0 && S_ISDIR(st.st_mode)) {
    close(fd);
    if (error) *error = "cannot read " + path + ": is a directory";
    return std::nullopt;
  }
  std::string out;
  char buf[65536];
  for (;;) {
    const ssize_t n = read(fd, buf, sizeof buf);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (error) *error = ErrnoText("cannot read", path);
      close(fd);
      return std::nullopt;
    }
    if (n == 0) break;
    out.append(buf, static_cast<size_t>(n));
  }
  close(fd);
  return out;
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

bool MakeDirectories(const std::string& path) {
  if (path.empty()) {
    errno = ENOENT;
    return false;
  }
  struct stat st;
  if (stat(path.c_str(), &st) == 0) {
    if (S_ISDIR(st.st_mode)) return true;
    errno = ENOTDIR;  // a file stands where a directory must be
    return false;
  }
  const size_t slash = path.find_last_of('/');
  if (slash != std::string::npos && slash > 0 && !MakeDirectories(path.substr(0, slash))) return false;
  if (mkdir(path.c_str(), 0755) == 0) return true;
  // Another process may have made it meanwhile; anything else keeps mkdir's errno.
  if (errno != EEXIST) return false;
  if (stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return true;
  errno = ENOTDIR;
  return false;
}

bool WriteFileAtomically(const std::string& path, std::string_view bytes, std::string* error, int mode) {
  const size_t slash = path.find_last_of('/');
  const std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
  if (!MakeDirectories(dir)) {
    if (error) *error = ErrnoText("cannot create directory", dir);
    return false;
  }
  std::string temp = path + ".tmp.XXXXXX";
  const int fd = mkstemp(temp.data());
  if (fd < 0) {
    if (error) *error = ErrnoText("cannot create temporary file beside", path);
    return false;
  }
  auto fail = [&](const char* what) {
    if (error) *error = ErrnoText(what, temp);
    close(fd);
    unlink(temp.c_str());
    return false;
  };
  size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      return fail("cannot write");
    }
    done += static_cast<size_t>(n);
  }
  if (fchmod(fd, static_cast<mode_t>(mode)) != 0) return fail("cannot set mode of");
  if (fsync(fd) != 0) return fail("cannot sync");
  if (close(fd) != 0) {
    if (error) *error = ErrnoText("cannot close", temp);
    unlink(temp.c_str());
    return false;
  }
  if (testing::g_before_rename_hook) testing::g_before_rename_hook(temp);
  if (rename(temp.c_str(), path.c_str()) != 0) {
    if (error) *error = ErrnoText("cannot rename temporary file to", path);
    unlink(temp.c_str());
    return false;
  }
  const int dfd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dfd >= 0) {
    fsync(dfd);
    close(dfd);
  }
  return true;
}

}  // namespace platform
