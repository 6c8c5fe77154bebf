#include "platform/system.h"

#include <errno.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "cf/plist.h"
#include "platform/clock.h"
#include "platform/context.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/profile.h"

cf::Value _CFCopySystemVersionDictionary() {
  cf::Dictionary profile = platform::ReadProfileDictionary("/device/system-version.plist");
  if (!profile.empty()) return profile;
  auto release = platform::ReadOsRelease();
  cf::Dictionary d;
  if (!release["NAME"].empty()) d.Set("ProductName", release["NAME"]);
  if (!release["VERSION_ID"].empty()) d.Set("ProductVersion", release["VERSION_ID"]);
  const std::string build = !release["BUILD_ID"].empty() ? release["BUILD_ID"] : release["VERSION_ID"];
  if (!build.empty()) d.Set("ProductBuildVersion", build);
  return d;
}

namespace platform {
namespace {

int Fail(int error) {
  errno = error;
  return -1;
}

// Bytes (data, or text with its NUL) go into any buffer at least as large;
// the size becomes their length.
int CopyOut(const void* bytes, size_t n, void* buffer, size_t* size) {
  if (*size < n) return Fail(ENOMEM);
  std::memcpy(buffer, bytes, n);
  *size = n;
  return 0;
}

// The swap total of /proc/meminfo, in bytes.
bool SwapTotal(uint64_t* bytes) {
  const auto text = ReadFile("/proc/meminfo");
  if (!text) return false;
  const size_t at = text->find("SwapTotal:");
  if (at == std::string::npos) return false;
  *bytes = std::strtoull(text->c_str() + at + 10, nullptr, 10) * 1024;
  return true;
}

}  // namespace

namespace {

constexpr const char* kEccQueue = "/device/ecc-events.plist";
constexpr size_t kEccRecordSize = 72;

// The 72-byte record of an ECC event: id, count, six bytes of padding and
// eight signed 64-bit registers, little-endian.
std::optional<std::string> EccRecord(const cf::Dictionary& event) {
  const cf::Number* id = event.Get("id").AsNumber();
  const cf::Number* count = event.Get("count").AsNumber();
  const cf::Array* regs = event.Get("reg").AsArray();
  if (!id || !count || (!event.Get("reg").IsNull() && !regs) || (regs && regs->size() > 8)) return std::nullopt;
  std::string record(kEccRecordSize, '\0');
  record[0] = static_cast<char>(id->AsUInt32());
  record[1] = static_cast<char>(count->AsUInt32());
  for (size_t i = 0; regs && i < regs->size(); ++i) {
    const cf::Number* r = (*regs)[i].AsNumber();
    if (!r) return std::nullopt;
    const int64_t v = r->AsSInt64();
    std::memcpy(record.data() + 8 + 8 * i, &v, 8);
  }
  return record;
}

// Writes the ECC queue back without its first item.
bool DropFirstEccItem(const cf::Array& items) {
  cf::Array rest;
  for (size_t i = 1; i < items.size(); ++i) rest.Append(items[i]);
  std::string xml, why;
  if (!cf::WriteXMLPropertyList(cf::Value(rest), xml, &why) ||
      !WriteFileAtomically(Context::Current().Path(kEccQueue), xml, &why)) {
    LogError("Cannot consume an ECC event: %s", why);
    return false;
  }
  return true;
}

// The event the last read handed out, still first in the queue until the
// caller has kept it.
struct DeliveredEcc {
  std::string queue;  // the queue file it came from
  cf::Value item;
};
std::optional<DeliveredEcc>& Delivered() {
  static std::optional<DeliveredEcc> delivered;
  return delivered;
}

// "kern.next_ecc_event" over device/ecc-events.plist. Each successful read
// yields the next event; the event a read hands out leaves the queue only
// at the next read, when the caller has recorded it. A run stopped in
// between finds it again, and the structured-data log keeps a record once
// a day, so a repeat adds nothing; an event that was read but not recorded
// (the reading stopped, or the record could not be kept) stays for the next
// run. {"errno": N} as the next item fails that read with N, and is
// consumed at once. No file: not handled here.
int NextEccEvent(void* buffer, size_t* size, bool* handled) {
  const std::string path = Context::Current().Path(kEccQueue);
  const cf::Value queue = ReadProfileValue(kEccQueue);
  *handled = !queue.IsNull();
  std::optional<DeliveredEcc> delivered = std::exchange(Delivered(), std::nullopt);
  if (!*handled) return 0;
  const cf::Array* items = queue.AsArray();
  if (!items) {
    LogError("%s must be an array of events", path);
    return Fail(EINVAL);
  }
  cf::Array pending = *items;
  if (delivered && delivered->queue == path && !pending.empty() && pending[0] == delivered->item) {
    if (!DropFirstEccItem(pending)) return Fail(EIO);
    cf::Array rest;
    for (size_t i = 1; i < pending.size(); ++i) rest.Append(pending[i]);
    pending = std::move(rest);
  }
  if (pending.empty()) return Fail(ENOENT);
  const cf::Value& next = pending[0];
  std::optional<std::string> bytes;
  int error = 0;
  if (const cf::Data* d = next.AsData()) {
    bytes = std::string(reinterpret_cast<const char*>(d->data()), d->size());
  } else if (const cf::Dictionary* e = next.AsDictionary(); e && e->Get("errno").AsNumber()) {
    error = e->Get("errno").AsNumber()->AsSInt32();
  } else if (e) {
    bytes = EccRecord(*e);
  }
  if (!bytes && !error) {
    LogError("%s: the next event is not {\"id\", \"count\", \"reg\"}, {\"errno\"} or data; it is skipped", path);
    error = EINVAL;
  }
  if (error) return DropFirstEccItem(pending) ? Fail(error) : Fail(EIO);
  if (*size < bytes->size()) return Fail(ENOMEM);  // not handed out: the caller may ask again
  Delivered() = DeliveredEcc{path, next};
  return CopyOut(bytes->data(), bytes->size(), buffer, size);
}

}  // namespace

int Sysctl(const char* name, void* buffer, size_t* size) {
  if (!name || !buffer || !size) return Fail(EINVAL);
  if (std::string_view(name) == "kern.next_ecc_event") {
    bool handled = false;
    const int rc = NextEccEvent(buffer, size, &handled);
    if (handled) return rc;
  }
  const cf::Value v = ReadProfileEntry("/device/sysctl.plist", name);
  if (const cf::Number* n = v.AsNumber()) {
    const uint64_t value = n->AsUInt64();
    if (*size == 8) return CopyOut(&value, 8, buffer, size);
    if (*size == 4 && value <= UINT32_MAX) {
      const uint32_t narrow = static_cast<uint32_t>(value);
      return CopyOut(&narrow, 4, buffer, size);
    }
    return Fail(ENOMEM);
  }
  if (const cf::Data* d = v.AsData()) return CopyOut(d->data(), d->size(), buffer, size);
  if (const cf::String* text = v.AsString()) return CopyOut(text->c_str(), text->size() + 1, buffer, size);
  if (!v.IsNull()) return Fail(EINVAL);

  const std::string key = name;
  if (key == "vm.swapusage") {
    // {total, available, used, flags}: only the total is known here.
    uint64_t record[4] = {0, 0, 0, 0};
    if (!SwapTotal(&record[0])) return Fail(ENOENT);
    return CopyOut(record, sizeof record, buffer, size);
  }
  if (key == "kern.bootsessionuuid") {
    auto id = ReadFile("/proc/sys/kernel/random/boot_id");
    if (!id) return Fail(ENOENT);
    while (!id->empty() && (id->back() == '\n' || id->back() == ' ')) id->pop_back();
    const std::string text = *id + '\0';
    return CopyOut(text.data(), text.size(), buffer, size);
  }
  return Fail(ENOENT);
}

uint64_t PageSize() {
  const long n = sysconf(_SC_PAGESIZE);
  return n > 0 ? static_cast<uint64_t>(n) : 4096;
}

}  // namespace platform

uint64_t mach_absolute_time() { return platform::MonotonicNanos(); }

int mach_timebase_info(mach_timebase_info_data_t* info) {
  if (!info) return 4;  // an invalid argument, as the kernel would say
  return platform::Context::Current().clock().Timebase(&info->numer, &info->denom) ? 0 : 5;
}

LSApplicationWorkspace& LSApplicationWorkspace::defaultWorkspace() {
  static LSApplicationWorkspace workspace;
  return workspace;
}

void LSApplicationWorkspace::enumerateBundlesOfType(int type, const std::function<void(const LSBundleProxy&)>& block) {
  if (type != 1) return;
  const cf::Value apps = platform::ReadProfileValue("/device/apps.plist");
  const cf::Array* list = apps.AsArray();
  if (!list) return;
  for (const cf::Value& app : *list) {
    const cf::Dictionary* d = app.AsDictionary();
    if (!d) continue;
    LSBundleProxy proxy;
    if (auto id = d->Get("bundleIdentifier").AsString()) proxy.bundleIdentifier = *id;
    if (auto kind = d->Get("bundleType").AsString()) proxy.bundleType = *kind;
    block(proxy);
  }
}

namespace {

// "en_US.UTF-8@euro" -> "en-US"; nothing for C and POSIX.
std::string LanguageTag(std::string locale) {
  locale = locale.substr(0, locale.find_first_of(".@"));
  if (locale.empty() || locale == "C" || locale == "POSIX") return {};
  for (char& c : locale)
    if (c == '_') c = '-';
  return locale;
}

std::string LanguageOf(const std::string& tag) { return tag.substr(0, tag.find('-')); }

}  // namespace

cf::Array preferredLanguages() {
  cf::Array out;
  const std::string language = platform::EnvOr("LANGUAGE", "");
  if (!language.empty()) {
    size_t start = 0;
    while (start <= language.size()) {
      size_t end = language.find(':', start);
      if (end == std::string::npos) end = language.size();
      const std::string tag = LanguageTag(language.substr(start, end - start));
      if (!tag.empty()) out.Append(tag);
      start = end + 1;
    }
    if (!out.empty()) return out;
  }
  const std::string tag = LanguageTag(platform::EnvOr("LANG", ""));
  if (!tag.empty()) out.Append(tag);
  return out;
}

cf::Array systemLanguages() {
  const cf::Value v = platform::ReadProfileEntry("/device/answers.plist", "SystemLanguages");
  cf::Array out;
  if (const cf::Array* a = v.AsArray())
    for (const cf::Value& item : *a)
      if (item.AsString()) out.Append(item);
  if (out.empty()) out.Append("en");
  return out;
}

cf::Array preferredLocalizationsFromArray(const cf::Array& available, const cf::Array& preferences) {
  for (const cf::Value& pref : preferences) {
    const cf::String* p = pref.AsString();
    if (!p) continue;
    for (const cf::Value& a : available)
      if (a.AsString() && *a.AsString() == *p) return cf::Array({a});
    for (const cf::Value& a : available)
      if (a.AsString() && LanguageOf(*a.AsString()) == LanguageOf(*p)) return cf::Array({a});
  }
  return cf::Array();
}

cf::Value CurrentLocaleCountryCode() {
  const std::string tag = LanguageTag(platform::EnvOr("LANG", ""));
  const size_t dash = tag.find('-');
  if (dash == std::string::npos || dash + 1 >= tag.size()) return {};
  return tag.substr(dash + 1);
}
