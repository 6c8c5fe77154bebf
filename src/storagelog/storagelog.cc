#include "storagelog/storagelog.h"

#include <errno.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "cf/bytes.h"
#include "nandinfo/controller.h"
#include "nandinfo/nandinfo_dict.h"
#include "platform/clock.h"
#include "platform/diagnostics.h"
#include "platform/log.h"
#include "platform/prefs.h"
#include "storagelog/telemetry.h"

namespace {

// Set by each DumpStorageStructuredLog, read by the validity handler of the
// same call.
struct WriteAmplification {
  double user = 0;
  double intermediate = 0;
  bool above_threshold = false;
};
WriteAmplification g_amplification;

// The user and intermediate write amplification from the statistics; both
// 0 when they cannot be fetched.
WriteAmplification MeasureWriteAmplification() {
  WriteAmplification wamp;
  VSPParseCxt context;
  nand_exporter_t* exporter = nullptr;
  // A failed fetch leaves nothing to release beyond what the context owns.
  if (!gatherVSPStatsData(&exporter, &context)) return wamp;
  const uint32_t band_units = (context.pagesPerVirtualBlock * context.bytesPerPage) >> 12;
  const double host_writes = static_cast<double>(context.hostWrites);
  wamp.user = static_cast<float>(static_cast<double>(context.bandErases * band_units) / host_writes);
  uint64_t slc_units = 0, intermediate_erases = 0;
  for (const ParserPair& pair : context.pairs) {
    if (pair.name == "pagesPerVirtualBlockSlc") slc_units = (pair.value * context.bytesPerPage) >> 12;
    else if (pair.name == "intermediateBandErases") intermediate_erases = pair.value;
  }
  if (slc_units && intermediate_erases)
    wamp.intermediate = static_cast<float>(static_cast<double>(slc_units * intermediate_erases) / host_writes);
  exporter->releaseContext(&context);
  return wamp;
}

// The threshold is "userWAmp" of the NAND info domain when it is a real
// number strictly between 0 and 10, else 2.
bool AboveThreshold(double user_wamp) {
  const cf::Value pref = CFPreferencesCopyAppValue(cf::Value("userWAmp"), "com.velmora.NANDInfo");
  if (const cf::Number* n = pref.AsNumber(); n && n->IsFloat()) {
    const float v = n->AsFloat32();
    if (v > 0 && v < 10) return user_wamp > v;
  }
  return user_wamp > 2.0;
}

struct Retrieval {
  SelectorGetter getter;
  StorageListHandler handler;
  uint32_t mode;
};
constexpr size_t kMaxRetrievals = 5;

// The lists this controller kind can give, in the order they are fetched.
std::vector<Retrieval> SelectorFunctions(const nand_exporter_t& kind) {
  std::vector<Retrieval> retrievals;
  if (kind.getBandStatsSelectors) retrievals.push_back({kind.getBandStatsSelectors, ParseValidityList, 0});
  else std::fputs("Validity list retrieval is not supported\n", stderr);
  if (kind.getTelemetryListSelectors)
    for (uint32_t mode : {0u, 1u, 2u}) retrievals.push_back({kind.getTelemetryListSelectors, ParseTelemetryList, mode});
  else std::fputs("Telemetry list retrieval is not supported\n", stderr);
  if (kind.getDefectsListSelectors) retrievals.push_back({kind.getDefectsListSelectors, ParseDefectsList, 0});
  else std::fputs("Defects list retrieval is not supported\n", stderr);
  return retrievals;
}

struct FreeDeleter {
  void operator()(void* p) const { std::free(p); }
};

// Fetches retrieval i and hands it to its handler; false when the list
// could not be held or its handler refused it.
bool FetchList(io_connect_t connection, const nand_exporter_t& kind, const Retrieval& r, size_t i, bool verbose,
               const cf::Value& characteristics) {
  const tunnel_selectors_t* selectors = r.getter();
  if (!selectors) return false;
  tunnel_command_t command{};
  command.command = selectors->sizeCommand;
  command.phase = 1 | (verbose ? 2 : 0) | ((r.mode & 0xFF) << 2);
  uint8_t input[24];
  EncodeTunnelCommand(command, input);
  uint32_t size = 0;
  size_t size_bytes = sizeof size;
  if (const kern_return_t rc = IOConnectCallStructMethod(connection, kind.sizeMethod, input, sizeof input, &size,
                                                         &size_bytes);
      rc != kIOReturnSuccess) {
    std::fprintf(stderr, "IOConnectCallStructMethod failed with status 0x%x on selector index %zu\n",
                 static_cast<unsigned>(rc), i);
    return true;
  }
  if (size == 0) return true;
  void* memory = nullptr;
  const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
  if (posix_memalign(&memory, page, size) != 0) {
    std::fprintf(stderr, "Could not malloc %zd bytes\n", static_cast<ssize_t>(size));
    return false;
  }
  std::unique_ptr<uint8_t, FreeDeleter> buffer(static_cast<uint8_t*>(memory));
  command.command = selectors->dataCommand;
  command.phase = (verbose ? 2 : 0) | ((r.mode & 0xFF) << 2);
  EncodeTunnelCommand(command, input);
  size_t returned = size;
  if (IOConnectCallStructMethod(connection, kind.dataMethod, input, sizeof input, buffer.get(), &returned) !=
      kIOReturnSuccess) {
    std::fprintf(stderr, "Could not retrieve data from driver for selector %u\n", selectors->dataCommand);
    return true;
  }
  // Only the bytes the controller wrote are handed on.
  return r.handler(buffer.get(), std::min<size_t>(returned, size), characteristics, kind.className);
}

void CloseConnection(io_connect_t connection) {
  if (IOServiceClose(connection) != kIOReturnSuccess) std::fputs("Could not close connection to service\n", stderr);
}

}  // namespace

bool DumpStorageStructuredLog(bool verbose) {
  g_amplification = MeasureWriteAmplification();
  g_amplification.above_threshold = AboveThreshold(g_amplification.user);

  nand_exporter_t* kind = nullptr;
  // Closed and released on every way out, a throwing handler's too.
  struct OpenService {
    io_service_t service = 0;
    io_connect_t connection = 0;
    ~OpenService() {
      if (connection) CloseConnection(connection);
      if (service) IOObjectRelease(service);
    }
  } open;
  open.service = findNandExporter(&kind);
  if (!open.service || !kind) {
    std::fputs("Could not get matching IOKit service for exporting classes\n", stderr);
    return false;
  }
  if (IOServiceOpen(open.service, mach_task_self(), 0, &open.connection) != kIOReturnSuccess) {
    open.connection = 0;
    std::fputs("Could not get connection to service\n", stderr);
    return false;
  }
  const cf::Value characteristics = IORegistryEntrySearchCFProperty(
      open.service, kIOServicePlane, kind->propertyMatchKey, kIORegistryIterateRecursively | kIORegistryIterateParents);
  if (characteristics.IsNull()) {
    std::fputs("failed to create dictionary\n", stderr);
    return false;
  }
  const std::vector<Retrieval> retrievals = SelectorFunctions(*kind);
  if (retrievals.size() > kMaxRetrievals) {
    std::fputs("Increase the size of the selectorFunctions Array\n", stderr);
    return true;
  }
  bool result = true;
  for (size_t i = 0; i < retrievals.size(); ++i)
    result = FetchList(open.connection, *kind, retrievals[i], i, verbose, characteristics) && result;
  return result;
}

std::optional<std::array<cf::Array, 16>> ValidityValues(const uint8_t* data, size_t size) {
  const uint64_t count = size >= 8 ? cf::LoadLE32(data) : 0;
  const uint64_t extra = size >= 8 ? cf::LoadLE32(data + 4) : 0;
  if (count == 0 || size < 4 * (2 + 2 * extra + 5 * count)) return std::nullopt;
  std::array<cf::Array, 16> lists;
  const size_t entries = 8 + 8 * extra;
  for (uint64_t e = 0; e < count; ++e) {
    const size_t at = entries + 20 * e;
    const uint32_t list = cf::LoadLE32(data + at + 4);
    if (list < lists.size()) lists[list].Append(cf::Value::SInt32(static_cast<int32_t>(cf::LoadLE32(data + at + 8))));
  }
  return lists;
}

bool ParseValidityList(const uint8_t* data, size_t size, const cf::Value&, std::string_view) {
  if (!g_amplification.above_threshold) return true;
  const std::optional<std::array<cf::Array, 16>> lists = ValidityValues(data, size);
  if (!lists) {
    std::fputs("data cannot be parsed\n", stderr);
    return false;
  }
  cf::Dictionary values;
  values.Set("IntermediateWamp", cf::Value::Float64(g_amplification.intermediate));
  values.Set("UserWamp", cf::Value::Float64(g_amplification.user));
  DumpNANDInfo(values);
  for (size_t d = 0; d < lists->size(); ++d)
    if (!(*lists)[d].empty()) values.Set("ValidityList[" + std::to_string(d) + "]", (*lists)[d]);
  NLW_WriteLog("165", values);
  return true;
}

bool ForEachDefectRecord(const uint8_t* data, size_t size, const cf::Value& characteristics,
                         std::string_view class_name, const std::function<void(const cf::Dictionary&)>& each) {
  if (size < 12) return false;
  cf::Dictionary header;
  header.Set("Factory Count", cf::Value::SInt32(static_cast<int32_t>(cf::LoadLE32(data + 4))));
  if (const cf::Dictionary* c = characteristics.AsDictionary())
    if (const cf::Number* desc = c->Get("nand-device-desc").AsNumber())
      header.Set("com.velmora.NANDInfo.nandDesc", cf::Value::SInt32(desc->AsSInt32()));
  each(header);
  // Entries go as far as the bytes do, whatever the count claims.
  const uint64_t count = std::min<uint64_t>(cf::LoadLE32(data + 8), (size - 12) / 32);
  for (uint64_t e = 0; e < count; ++e) {
    const uint8_t* entry = data + 12 + 32 * e;
    auto word = [&](size_t w) { return cf::LoadLE32(entry + 4 * w); };
    uint32_t reason = word(4);
    if (class_name != "VSPStorage") {
      switch (const uint32_t mode = word(7)) {
        case 0: break;
        case 1: reason += 200; break;
        case 2: reason += 100; break;
        default: std::fprintf(stderr, "Encountered unexpected defectMode: 0x%x\n", mode);
      }
    }
    cf::Dictionary defect;
    auto set = [&](const char* key, uint32_t v) { defect.Set(key, cf::Value::SInt32(static_cast<int32_t>(v))); };
    set("Bus", word(0) & 0xFFFF);
    set("CE", word(0) >> 16);
    set("CAU", word(1));
    set("Block", word(2));
    set("Cycle", word(3));
    set("Reason", reason);
    set("Page", word(5));
    defect.Set("Temperature", cf::Number::SInt8(static_cast<int8_t>(word(6) & 0xFF)));
    each(defect);
  }
  return true;
}

bool ParseDefectsList(const uint8_t* data, size_t size, const cf::Value& characteristics,
                      std::string_view class_name) {
  const bool read = ForEachDefectRecord(data, size, characteristics, class_name,
                                       [](const cf::Dictionary& record) { FKLogStructuredData(176, record); });
  if (!read) std::fputs("data cannot be parsed\n", stderr);
  return read;
}

void DumpNANDInfo(cf::Dictionary& target) {
  VSPParseCxt context;
  nand_exporter_t* kind = nullptr;
  if (!gatherVSPStatsData(&kind, &context)) return;
  const cf::Dictionary info = BuildNANDInfoDictFromStatsCxt(context, true);
  kind->releaseContext(&context);
  for (const auto& [key, value] : info) target.Set(key, value);
}

namespace {

// "key:value" for the log line, or nothing for a value it does not show.
std::optional<std::string> LogEntry(const std::string& key, const cf::Value& value) {
  if (const cf::Number* n = value.AsNumber()) {
    char buf[64];
    switch (n->type()) {
      case cf::NumberType::kFloat32:
      case cf::NumberType::kFloat:
        std::snprintf(buf, sizeof buf, "%.2f", static_cast<double>(n->AsFloat32()));
        return key + ":" + buf;
      case cf::NumberType::kFloat64:
      case cf::NumberType::kDouble:
        std::snprintf(buf, sizeof buf, "%.2f", n->AsFloat64());
        return key + ":" + buf;
      default: return key + ":" + value.Description();
    }
  }
  if (const cf::Array* a = value.AsArray()) {
    bool holds_number = false;
    std::string joined;
    for (size_t i = 0; i < a->size(); ++i) {
      holds_number = holds_number || (*a)[i].AsNumber();
      joined += (i ? "," : "") + (*a)[i].Description();
    }
    if (holds_number) return key + ":" + joined;
  }
  return std::nullopt;
}

}  // namespace

void NLW_WriteLog(std::string_view bug_type, const cf::Value& values) {
  constexpr double kSevenDays = 604800;
  const double now = platform::Now();
  const cf::Value last = UserDefaultsGetValue(cf::Value("SSLastLoggedAt"));
  if (const cf::Date* at = last.AsDate(); at && now - at->seconds < kSevenDays) {
    platform::LogDefault("NANDLogWriter:Last written at %@ current %@ :skipped", last, cf::Value(cf::Date{now}));
    return;
  }
  // The folder is the record of what went out: a log whose run stopped
  // before it could note the time still starts the week.
  for (const platform::Submission& s : platform::ListSubmissions("StorageStatus")) {
    if (now - s.created >= kSevenDays) continue;
    platform::LogDefault("NANDLogWriter:%@ went out at %@ current %@ :skipped", s.file, cf::Value(cf::Date{s.created}),
                         cf::Value(cf::Date{now}));
    UserDefaultsSetValue(cf::Value("SSLastLoggedAt"), cf::Value(cf::Date{s.created}));
    UserDefaultsSynchronize();
    return;
  }
  try {
    const cf::Dictionary* d = values.AsDictionary();
    if (!d) return;
    const std::string date = platform::LocalStamp(now, "%Y-%m-%d %H:%M:%S %z");
    std::string entries;
    for (const auto& [key, value] : *d) {
      if (!key.AsString()) continue;
      if (std::optional<std::string> entry = LogEntry(*key.AsString(), value))
        entries += (entries.empty() ? "" : ";") + *entry;
    }
    const std::string line = cf::Format("%@ %@[%d]: %@\n", date, std::string(program_invocation_short_name),
                                        static_cast<int>(getpid()), entries);
    const std::string report = cf::Format(
        "System ID: %@\nHardware Model: %@\nOS Version: %@\nDate: %@\nIncident ID: %@\nFaultkeep Key: %@\n\n%@",
        GetSysIDWithDescription(false), GetHardwareModel(), GetSystemVersion(), date, GetIncidentID(),
        GetFaultkeepKey(), line);
    const bool written = DGVWriteLogForSubmission(bug_type, "StorageStatus", cf::Value(), cf::Value(),
                                                  [&](platform::LogOutput& out) { out.Write(report); });
    // The week starts again only once a log went out.
    if (!written) return;
    UserDefaultsSetValue(cf::Value("SSLastLoggedAt"), cf::Value(cf::Date{now}));
    UserDefaultsSynchronize();
  } catch (const std::exception& e) {
    platform::LogDefault("An exception occurred: %@", std::string(e.what()));
  }
}

std::string GetFaultkeepKey() {
  const cf::Value answer = DVCopyAnswer("InverseDeviceID");
  return answer.AsString() ? answer.AsString()->str() : "error";
}

namespace storagelog::testing {
void SetWriteAmplification(double user, double intermediate, bool above_threshold) {
  g_amplification = {user, intermediate, above_threshold};
}
}  // namespace storagelog::testing
