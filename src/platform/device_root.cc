#include "platform/device_root.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "platform/files.h"
#include "platform/store.h"

namespace platform {

namespace {

namespace fs = std::filesystem;

std::string Canonical(const std::string& dir) {
  std::error_code ec;
  const fs::path p = fs::weakly_canonical(fs::absolute(dir, ec), ec);
  return ec ? fs::path(dir).lexically_normal().string() : p.string();
}

bool IsRegularFile(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

std::string HowToMake(const std::string& dir) {
  return "make one with: devsim init " + dir + " (and set TALLYRUN_ROOT=" + dir + ")";
}

}  // namespace

bool IsProtectedDirectory(const std::string& dir) {
  const std::string here = Canonical(dir);
  if (here == "/") return true;
  if (const char* home = std::getenv("HOME"); home && *home && here == Canonical(home)) return true;
  if (const struct passwd* pw = getpwuid(geteuid()); pw && pw->pw_dir && *pw->pw_dir && here == Canonical(pw->pw_dir))
    return true;
  return false;
}

bool HasRootMarker(const std::string& dir) { return IsRegularFile(dir + "/" + kRootMarkerName); }

bool WriteRootMarker(const std::string& dir, std::string* error) {
  return WriteFileAtomically(dir + "/" + kRootMarkerName,
                             "A tallyrun device root, made by devsim init. The tools change files only in a "
                             "directory that holds this file.\n",
                             error);
}

RootCheck CheckDeviceRoot(const std::string& dir) {
  struct stat st;
  if (stat(dir.c_str(), &st) != 0) {
    const int cause = errno;
    if (cause == ENOENT) return {RootStatus::kMissing, "no device root at " + dir + "; " + HowToMake(dir)};
    return {RootStatus::kUnreadable, "cannot use the device root " + dir + ": " + std::strerror(cause)};
  }
  if (!S_ISDIR(st.st_mode)) return {RootStatus::kNotADirectory, "the device root " + dir + " is not a directory"};
  if (IsProtectedDirectory(dir))
    return {RootStatus::kProtected, dir + " is never a device root; " + HowToMake("DIR")};
  // A root that grants no one reading is locked on purpose, even against
  // the superuser, who would otherwise fill it with files of its own.
  const bool locked = (st.st_mode & (S_IRUSR | S_IRGRP | S_IROTH)) == 0;
  if (locked || access(dir.c_str(), R_OK | X_OK) != 0) {
    const int cause = locked ? EACCES : errno;
    return {RootStatus::kUnreadable, "cannot read the device root " + dir + ": " + std::strerror(cause)};
  }
  if (HasRootMarker(dir) || IsRegularFile(dir + kStoreDevicePath)) return {RootStatus::kRoot, ""};
  return {RootStatus::kNotARoot, dir + " is not a device root (it has no " + kRootMarkerName + " and no store); " +
                                     HowToMake(dir)};
}

}  // namespace platform
