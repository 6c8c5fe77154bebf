#include "platform/prefs.h"

#include <sys/stat.h>

#include <cstdlib>

#include "cf/plist.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"

namespace platform {

bool IsValidPreferenceDomain(std::string_view domain) {
  return !domain.empty() && domain.front() != '.' && domain.find('/') == std::string_view::npos &&
         domain.find('\0') == std::string_view::npos;
}

Preferences::Preferences(std::string directory) : directory_(std::move(directory)) {}
Preferences::~Preferences() = default;

std::string Preferences::PathFor(std::string_view domain) const {
  return directory_ + "/" + std::string(domain) + ".plist";
}

namespace {
constexpr int64_t kMaxPreferenceFileBytes = int64_t{16} << 20;
}  // namespace

Preferences::Domain* Preferences::Load(std::string_view domain) {
  if (!IsValidPreferenceDomain(domain)) {
    LogError("Invalid preference domain \"%s\"", std::string(domain));
    return nullptr;
  }
  auto it = domains_.find(domain);
  if (it == domains_.end()) it = domains_.emplace(std::string(domain), Domain{}).first;
  Domain& d = it->second;

  // Read fresh, but only when the file changed since we last looked.
  const std::string path = PathFor(domain);
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) {
    // No file (any more): nothing on disk; pending changes stay pending.
    d.on_disk = cf::Dictionary();
    d.mtime_ns = d.size = -1;
    d.inode = 0;
    d.bad_file_reported = false;
    return &d;
  }
  const int64_t mtime = static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec;
  if (mtime == d.mtime_ns && st.st_size == d.size && st.st_ino == d.inode) return &d;
  d.mtime_ns = mtime;
  d.size = st.st_size;
  d.inode = st.st_ino;
  d.on_disk = cf::Dictionary();
  std::string error;
  // Never through a link: a domain linked to a file elsewhere is not read.
  const auto bytes = ReadRegularFile(path, kMaxPreferenceFileBytes, &error);
  cf::ParseResult parsed;
  if (bytes) parsed = cf::ParsePropertyList(*bytes);
  else parsed.error = error;
  if (parsed.ok() && parsed.value.AsDictionary()) {
    d.on_disk = *parsed.value.AsDictionary();
    d.bad_file_reported = false;
  } else if (!d.bad_file_reported) {
    // Read as empty; the file is left as it is until a later write.
    if (bytes)
      LogError("Preferences file %s is not a property-list dictionary (%s); reading it as empty", path,
               parsed.ok() ? "root is " + cf::TypeNameWithArticle(parsed.value.type()) : parsed.error);
    else
      LogError("Preferences file %s cannot be read (%s); reading it as empty", path, parsed.error);
    d.bad_file_reported = true;
  }
  return &d;
}

cf::Value Preferences::Get(std::string_view domain, const cf::Value& key) {
  Domain* d = Load(domain);
  if (!d) return {};
  if (const cf::Value* p = d->pending.Find(key)) return p->DeepCopy();
  return d->on_disk.Get(key).DeepCopy();
}

bool Preferences::Set(std::string_view domain, const cf::Value& key, cf::Value value) {
  if (!IsValidPreferenceDomain(domain)) {
    LogError("Invalid preference domain \"%s\"", std::string(domain));
    return false;
  }
  // The value is asked of the writer itself, so that what is refused here is
  // exactly what could not be written at synchronize.
  std::string why, scratch;
  // A key that is itself the bad text is not printed.
  std::string name = key.AsString() ? *key.AsString() : key.Description();
  if (!key.AsString()) {
    why = "the key is " + cf::TypeNameWithArticle(key.type()) + ", not a string";
  } else if (std::string text_why; !cf::IsPropertyListString(*key.AsString(), &text_why)) {
    why = "key cannot be written to a property list: " + text_why;
    name = "(unprintable key)";
  } else if (!value.IsNull() && !cf::WriteXMLPropertyList(value, scratch, &why) && why.empty()) {
    why = "the value cannot be written to a property list";
  }
  if (!why.empty()) {
    LogError("Not setting preference %s of domain %s: %s", name, std::string(domain), why);
    return false;
  }
  auto it = domains_.find(domain);
  if (it == domains_.end()) it = domains_.emplace(std::string(domain), Domain{}).first;
  it->second.pending.Set(key.DeepCopy(), value.DeepCopy());
  return true;
}

bool Preferences::Synchronize(std::string_view domain) {
  if (!IsValidPreferenceDomain(domain)) {
    LogError("Invalid preference domain \"%s\"", std::string(domain));
    return false;
  }
  auto it = domains_.find(domain);
  if (it == domains_.end() || it->second.pending.empty()) return true;
  Domain* d = Load(domain);  // merge into what is on disk now
  if (!d) return false;
  cf::Dictionary merged = d->on_disk.MutableCopy();
  for (const auto& [k, v] : d->pending) {
    if (v.IsNull()) merged.Remove(k);
    else merged.Set(k, v);
  }
  std::string bytes, error;
  if (!cf::WriteXMLPropertyList(cf::Value(merged), bytes, &error) ||
      !WriteFileAtomically(PathFor(domain), bytes, &error)) {
    LogError("Could not write preferences domain %s: %s", std::string(domain), error);
    return false;
  }
  d->pending.Clear();
  d->on_disk = merged;
  struct stat st;
  if (stat(PathFor(domain).c_str(), &st) == 0) {
    d->mtime_ns = static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec;
    d->size = st.st_size;
    d->inode = st.st_ino;
  }
  return true;
}

void Preferences::SynchronizeAll() {
  for (auto& [name, d] : domains_)
    if (!d.pending.empty()) Synchronize(name);
}

}  // namespace platform

using platform::Context;

namespace {

// Integers from numbers, booleans and numeric strings, as the platform's
// integer getter accepts them.
bool IntegerFrom(const cf::Value& v, int64_t* out) {
  if (auto n = v.AsNumber()) {
    *out = n->AsSInt64();
    return true;
  }
  if (auto b = v.AsBool()) {
    *out = *b;
    return true;
  }
  if (auto s = v.AsString()) {
    if (s->empty()) return false;
    char* end = nullptr;
    errno = 0;
    const long long x = std::strtoll(s->c_str(), &end, 10);
    if (errno != 0 || *end != '\0') return false;
    *out = x;
    return true;
  }
  return false;
}

bool BoolFrom(const cf::Value& v, bool* out) {
  if (auto b = v.AsBool()) {
    *out = *b;
    return true;
  }
  if (auto n = v.AsNumber()) {
    *out = n->IsFloat() ? n->AsFloat64() != 0 : n->AsSInt64() != 0;
    return true;
  }
  return false;
}

}  // namespace

cf::Value DGVPreferencesGetValue(const cf::Value& key, std::string_view domain) {
  std::lock_guard<std::recursive_mutex> lock(platform::SharedStateMutex());
  return Context::Current().preferences().Get(domain, key);
}

void DGVPreferencesSetValue(const cf::Value& key, const cf::Value& value, std::string_view domain) {
  std::lock_guard<std::recursive_mutex> lock(platform::SharedStateMutex());
  Context::Current().preferences().Set(domain, key, value);
}

int64_t DGVPreferencesGetIntegerValue(const cf::Value& key, std::string_view domain, bool* exists) {
  int64_t v = 0;
  const bool ok = IntegerFrom(DGVPreferencesGetValue(key, domain), &v);
  if (exists) *exists = ok;
  return ok ? v : 0;
}

bool DGVPreferencesGetBoolValue(const cf::Value& key, std::string_view domain, bool* exists) {
  bool b = false;
  if (!BoolFrom(DGVPreferencesGetValue(key, domain), &b)) return false;
  if (exists) *exists = true;
  return b;
}

bool DGVPreferencesSynchronize(std::string_view domain) {
  std::lock_guard<std::recursive_mutex> lock(platform::SharedStateMutex());
  return Context::Current().preferences().Synchronize(domain);
}

cf::Value CFPreferencesCopyAppValue(const cf::Value& key, std::string_view application) {
  return DGVPreferencesGetValue(key, application);
}

bool CFPreferencesGetAppBooleanValue(const cf::Value& key, std::string_view application, bool* valid) {
  bool b = false;
  const bool ok = BoolFrom(CFPreferencesCopyAppValue(key, application), &b);
  if (valid) *valid = ok;
  return ok && b;
}

cf::Value UserDefaultsGetValue(const cf::Value& key) {
  return DGVPreferencesGetValue(key, kStandardUserDefaultsDomain);
}

void UserDefaultsSetValue(const cf::Value& key, const cf::Value& value) {
  DGVPreferencesSetValue(key, value, kStandardUserDefaultsDomain);
}

bool UserDefaultsSynchronize() { return DGVPreferencesSynchronize(kStandardUserDefaultsDomain); }
