#include "platform/profile.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <ctime>
#include <functional>
#include <mutex>
#include <string_view>

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {
namespace {

struct Stamp {
  dev_t device = 0;
  ino_t inode = 0;
  int64_t size = 0;
  int64_t modified_ns = 0;
  bool operator==(const Stamp&) const = default;
};

// File systems stamp modifications with a coarse clock, so two writes within
// one tick (of the same size, the second reusing the first one's freed inode)
// can leave equal stamps. A file read this soon after its last change is
// compared by content next time too.
constexpr int64_t kStampSettleNs = 2'000'000'000;

struct CachedFile {
  Stamp stamp;
  bool settled = false;        // the stamp alone tells a later change
  bool refused = false;        // not read at all (not a regular file, too big, unreadable)
  bool has_content = false;    // content_hash describes bytes that were parsed
  size_t content_hash = 0;
  cf::Value value;             // null when refused or bad
  bool type_reported = false;  // "not a dictionary" was logged for this content
};

// Parses of the current context's profile files. Another context (a test's
// scope) starts afresh.
struct ProfileCache {
  std::mutex mu;
  uint64_t context_id = 0;
  std::map<std::string, CachedFile> files;
};

ProfileCache& Cache() {
  static ProfileCache cache;
  return cache;
}

int64_t WallNanos() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  return int64_t{now.tv_sec} * 1'000'000'000 + now.tv_nsec;
}

// Reads at most limit + 1 bytes, so a file that grew after fstat shows as too big.
bool ReadAll(int fd, int64_t limit, std::string* out) {
  char buf[65536];
  for (;;) {
    const size_t want = std::min<size_t>(sizeof buf, static_cast<size_t>(limit + 1) - out->size());
    if (want == 0) return true;
    const ssize_t n = read(fd, buf, want);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    if (n == 0) return true;
    out->append(buf, static_cast<size_t>(n));
  }
}

// Why a file is not read, or nothing when it may be.
std::string Refusal(const struct stat& st, const std::string& path) {
  if (!S_ISREG(st.st_mode)) return cf::Format("%s is not a regular file; ignoring it", path);
  if (st.st_size > kMaxProfileFileBytes)
    return cf::Format("%s is %lld bytes, over the limit of %lld; ignoring it", path, static_cast<long long>(st.st_size),
                      static_cast<long long>(kMaxProfileFileBytes));
  return {};
}

// Brings the cache entry of path up to date with the file and returns it;
// null (and no entry) when the file is missing. The caller holds the lock.
CachedFile* Load(ProfileCache& cache, const std::string& path) {
  // O_NONBLOCK: opening a FIFO must not wait for a writer.
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  struct stat st;
  if (fd < 0 || fstat(fd, &st) != 0) {
    if (fd >= 0) close(fd);
    cache.files.erase(path);
    return nullptr;
  }
  const Stamp stamp{st.st_dev, st.st_ino, static_cast<int64_t>(st.st_size),
                    int64_t{st.st_mtim.tv_sec} * 1'000'000'000 + st.st_mtim.tv_nsec};
  CachedFile& entry = cache.files[path];
  const bool same_stamp = entry.stamp == stamp;
  if (same_stamp && (entry.settled || entry.refused)) {
    close(fd);
    return &entry;
  }
  const bool settled = WallNanos() - stamp.modified_ns >= kStampSettleNs;
  const std::string refusal = Refusal(st, path);
  std::string bytes;
  const bool read = refusal.empty() && ReadAll(fd, kMaxProfileFileBytes, &bytes);
  const int read_error = errno;
  close(fd);
  if (!refusal.empty() || !read || static_cast<int64_t>(bytes.size()) > kMaxProfileFileBytes) {
    entry = CachedFile{stamp, settled, true, false, 0, {}, false};
    if (!refusal.empty()) LogError("%s", refusal);
    else if (!read) LogError("Cannot read %s: %s", path, std::strerror(read_error));
    else LogError("%s grew over the limit of %lld bytes while read; ignoring it", path,
                  static_cast<long long>(kMaxProfileFileBytes));
    return &entry;
  }
  const size_t hash = std::hash<std::string_view>()(bytes);
  if (entry.has_content && entry.content_hash == hash) {
    // The same bytes under a new stamp (touched, or rewritten alike): the parse stands.
    entry.stamp = stamp;
    entry.settled = settled;
    return &entry;
  }
  entry = CachedFile{stamp, settled, false, true, hash, {}, false};
  cf::ParseResult parsed = cf::ParsePropertyList(bytes);
  if (parsed.ok()) entry.value = std::move(parsed.value);
  else LogError("%s is not a property list (%s); ignoring it", path, parsed.error);
  return &entry;
}

// The cached value of a device file, shared with the cache: callers copy
// before handing it out. With want_dictionary, a value of another type is
// reported once per stamp and read as null.
cf::Value Cached(const std::string& device_path, bool want_dictionary) {
  Context& context = Context::Current();
  const std::string path = context.Path(device_path);
  ProfileCache& cache = Cache();
  std::lock_guard<std::mutex> lock(cache.mu);
  if (cache.context_id != context.id()) {
    cache.files.clear();
    cache.context_id = context.id();
  }
  CachedFile* entry = Load(cache, path);
  if (!entry) return {};
  if (want_dictionary && !entry->value.IsNull() && !entry->value.AsDictionary()) {
    if (!entry->type_reported)
      LogError("%s is %s, not a dictionary; ignoring it", path, cf::TypeNameWithArticle(entry->value.type()));
    entry->type_reported = true;
    return {};
  }
  return entry->value;
}

}  // namespace

cf::Value ReadProfileValue(const std::string& device_path) { return Cached(device_path, false).DeepCopy(); }

cf::Dictionary ReadProfileDictionary(const std::string& device_path) {
  const cf::Value v = Cached(device_path, true);
  if (v.IsNull()) return {};
  return *v.DeepCopy().AsDictionary();
}

cf::Value ReadProfileEntry(const std::string& device_path, std::string_view key) {
  const cf::Value v = Cached(device_path, true);
  return v.IsNull() ? cf::Value() : v.AsDictionary()->Get(std::string(key)).DeepCopy();
}

std::optional<std::string> ReadDeviceBytes(const std::string& device_path, std::string* error) {
  const std::string path = Context::Current().Path(device_path);
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd < 0) {
    if (errno != ENOENT && error) *error = cf::Format("Cannot read %s: %s", path, std::strerror(errno));
    return std::nullopt;
  }
  struct stat st;
  std::string bytes;
  std::string why = fstat(fd, &st) != 0 ? cf::Format("Cannot read %s: %s", path, std::strerror(errno)) : Refusal(st, path);
  if (why.empty() && !ReadAll(fd, kMaxProfileFileBytes, &bytes)) why = cf::Format("Cannot read %s: %s", path, std::strerror(errno));
  if (why.empty() && static_cast<int64_t>(bytes.size()) > kMaxProfileFileBytes)
    why = cf::Format("%s grew over the limit of %lld bytes while read; ignoring it", path,
                     static_cast<long long>(kMaxProfileFileBytes));
  close(fd);
  if (!why.empty()) {
    if (error) *error = why;
    return std::nullopt;
  }
  return bytes;
}

std::map<std::string, std::string> ReadOsRelease() {
  std::map<std::string, std::string> out;
  const auto text = ReadFile("/etc/os-release");
  if (!text) return out;
  size_t start = 0;
  while (start < text->size()) {
    size_t end = text->find('\n', start);
    if (end == std::string::npos) end = text->size();
    const std::string line = text->substr(start, end - start);
    start = end + 1;
    const size_t eq = line.find('=');
    if (eq == std::string::npos || line[0] == '#') continue;
    std::string value = line.substr(eq + 1);
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front())
      value = value.substr(1, value.size() - 2);
    out[line.substr(0, eq)] = value;
  }
  return out;
}

}  // namespace platform
