#include "platform/loader.h"

#include <dlfcn.h>
#include <errno.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "platform/context.h"
#include "platform/log.h"

namespace platform {

namespace {

// Why the file or directory at path must not be trusted, or empty. The root
// may be a link a deployment chose; nothing below it may be.
std::string Untrusted(const std::string& path, bool is_root, bool must_be_regular) {
  struct stat st;
  if ((is_root ? stat(path.c_str(), &st) : lstat(path.c_str(), &st)) != 0) return std::string(std::strerror(errno));
  if (S_ISLNK(st.st_mode)) return "is a symbolic link";
  if (must_be_regular && !S_ISREG(st.st_mode)) return "is not a regular file";
  if (st.st_uid != 0 && st.st_uid != geteuid())
    return "is owned by user " + std::to_string(st.st_uid) + ", neither root nor the running user";
  if (st.st_mode & (S_IWGRP | S_IWOTH)) return "is writable by its group or by others";
  return {};
}

}  // namespace

bool IsTrustedCode(const std::string& root, const std::string& path, std::string* why) {
  auto check = [&](const std::string& p, bool is_root, bool regular) {
    const std::string reason = Untrusted(p, is_root, regular);
    if (!reason.empty() && why) *why = p + " " + reason;
    return reason.empty();
  };
  if (path.compare(0, root.size() + 1, root + "/") != 0) return check(path, false, true);
  // Every directory from the root down to the file, then the file itself.
  if (!check(root, true, false)) return false;
  for (size_t at = path.find('/', root.size() + 1); at != std::string::npos; at = path.find('/', at + 1))
    if (!check(path.substr(0, at), false, false)) return false;
  return check(path, false, true);
}

}  // namespace platform

void* platform::LoadLibrary(std::string_view device_path) {
  const Context& context = Context::Current();
  const std::string path = context.Path(device_path);
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return nullptr;  // absent: a device without it
  std::string why;
  if (!IsTrustedCode(context.root(), path, &why)) {
    LogError("Not loading %s: %s", path, why);
    return nullptr;
  }
  return dlopen(path.c_str(), RTLD_LAZY | RTLD_LOCAL);
}

void* platform::FindSymbol(void* library, const char* name) { return library ? dlsym(library, name) : nullptr; }
