// devsim: the simulated device's tools. `devsim init DIR` writes a complete
// default device root (with --host, one whose controllers are this machine's
// disks); the others show what a root's devices give.

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "cf/plist.h"
#include "ioreport/ioreport.h"
#include "ioreport/samples.h"
#include "nandinfo/nandinfo.h"
#include "nandinfo/views.h"
#include "parsers/parsers.h"
#include "platform/context.h"
#include "platform/device_root.h"
#include "platform/files.h"
#include "tools/cli.h"
#include "tools/default_root.h"
#include "tools/output.h"

namespace {

constexpr int kBadInput = 2;

bool ReadInput(const std::string& path, std::string* bytes) {
  std::string error;
  auto content = platform::ReadFile(path, &error);
  if (!content) {
    std::fprintf(stderr, "devsim: %s\n", error.c_str());
    return false;
  }
  if (content->size() > UINT32_MAX) {
    std::fprintf(stderr, "devsim: %s is larger than 4 GiB\n", path.c_str());
    return false;
  }
  *bytes = std::move(*content);
  return true;
}

// One "name value" line per pair, then the parser's result and the message
// it recorded, if any.
int Parse(const std::string& kind, const std::string& file) {
  std::string bytes;
  if (!ReadInput(file, &bytes)) return kBadInput;
  const auto size = static_cast<uint32_t>(bytes.size());
  VSPParseCxt stats;
  GenericParserCxt generic;
  uint32_t result = 0;
  if (kind == "ftl") result = VSPFTLParseBufferToCxt(&generic, bytes.data(), size);
  else if (kind == "stats") result = VSPParseBufferToCxt(&stats, bytes.data(), size);
  else result = VSPMSPParseBufferToCxt(&generic, bytes.data(), size);
  for (const ParserPair& p : (kind == "stats" ? stats.pairs : generic.pairs))
    std::printf("%.*s %s\n", static_cast<int>(p.name.size()), p.name.data(), ParserPairValueText(p).c_str());
  std::printf("result %u\n", result);
  if (HasAPIErrorMessage()) std::printf("error: %s\n", GetAPIErrorMessage().c_str());
  return 0;
}

int Snapshot(const std::string& file, const std::string& header_file) {
  std::string data, header;
  if (!ReadInput(file, &data) || (!header_file.empty() && !ReadInput(header_file, &header))) return kBadInput;
  if (header_file.empty()) {
    std::vector<char> out(4096 + data.size() * 4);  // a record prints under 1 KiB per 252 bytes
    uint32_t size = static_cast<uint32_t>(out.size());
    const int result = VSPParseSnapshotBuffer(data.data(), static_cast<uint32_t>(data.size()), out.data(), &size);
    std::fwrite(out.data(), 1, result ? size : std::strlen(out.data()), stdout);
    return result ? 0 : 1;
  }
  // A header that describes no record would print nothing at all: say so.
  {
    std::vector<char> probe(std::max<size_t>(65536, header.size() + 4096));
    uint32_t size = static_cast<uint32_t>(probe.size()), index = 0;
    const int result = VSPParseSnapshotBufferWithInplaceParser(data.data(), static_cast<uint32_t>(data.size()),
                                                               probe.data(), &size, header.data(),
                                                               static_cast<uint32_t>(header.size()), &index);
    if (result && size <= 1) {
      std::fprintf(stderr, "devsim: the snapshot header %s (%zu bytes) describes no records; nothing to print\n",
                   header_file.c_str(), header.size());
      return kBadInput;
    }
  }
  // Piece by piece, as a caller with a fixed buffer would. The parser passes
  // over a record that does not fit, so the next piece starts again at that
  // record; when not even the first record of a piece (or the preamble)
  // fits, that piece is thrown away and redone in a buffer twice as large.
  constexpr size_t kLargestPiece = size_t{1} << 30;
  std::vector<char> out(std::max<size_t>(65536, header.size() + 4096));
  uint32_t index = 0;
  for (;;) {
    const uint32_t start = index;
    uint32_t size = static_cast<uint32_t>(out.size());
    const int result = VSPParseSnapshotBufferWithInplaceParser(data.data(), static_cast<uint32_t>(data.size()),
                                                               out.data(), &size, header.data(),
                                                               static_cast<uint32_t>(header.size()), &index);
    if (result || index > uint64_t{start} + 1) std::fwrite(out.data(), 1, size - 1, stdout);  // the text may hold a NUL
    if (result) return 0;
    if (index > uint64_t{start} + 1) {
      index -= 1;  // the record that did not fit
      continue;
    }
    index = start;
    if (out.size() >= kLargestPiece) {
      std::fprintf(stderr, "devsim: snapshot record %u does not fit in %zu bytes of text\n", start, out.size());
      return 1;
    }
    out.resize(out.size() * 2);
  }
}

// --force: a root made again keeps nothing of the old one (not its store,
// gate record, submissions or logs), so it is the root a fresh init gives.
// Only a root devsim made (it carries the marker) is emptied, never "/" or
// the home directory; each entry removed is named. False, after a message
// and with nothing removed, for anything else.
bool ClearOldRoot(const std::string& dir) {
  namespace fs = std::filesystem;
  std::error_code ec;
  if (platform::IsProtectedDirectory(dir)) {
    std::fprintf(stderr, "devsim: %s is never a device root; not removing anything\n", dir.c_str());
    return false;
  }
  if (!fs::exists(dir, ec) || fs::is_empty(dir, ec)) return true;
  if (!platform::HasRootMarker(dir)) {
    std::fprintf(stderr,
                 "devsim: %s is not empty and is not a device root made by devsim init (no %s); not removing "
                 "anything\n",
                 dir.c_str(), platform::kRootMarkerName);
    return false;
  }
  std::vector<fs::path> entries;
  for (const auto& e : fs::directory_iterator(dir, ec)) entries.push_back(e.path());
  std::sort(entries.begin(), entries.end());
  // The marker goes last, so a removal that stops half way leaves a root
  // that --force may still empty.
  std::stable_partition(entries.begin(), entries.end(),
                        [](const fs::path& p) { return p.filename() != platform::kRootMarkerName; });
  for (const fs::path& entry : entries) {
    // remove_all does not follow links: a link's target stays untouched.
    fs::remove_all(entry, ec);
    if (ec) {
      std::fprintf(stderr, "devsim: cannot remove %s: %s\n", entry.c_str(), ec.message().c_str());
      return false;
    }
    std::fprintf(stderr, "devsim: removed %s\n", entry.c_str());
  }
  return true;
}

// The support library, found from devsim's own place first: beside it in a
// build tree (so a moved tree still works), or where an install put it
// (relative, so any prefix or staging directory works); then where the
// build put it.
std::string SupportLibrary() {
  std::error_code ec;
  const auto self = std::filesystem::read_symlink("/proc/self/exe", ec);
  if (!ec) {
    for (const auto& candidate : {self.parent_path().parent_path() / "platform" / "FaultkeepSupport",
                                  self.parent_path() / INSTALLED_SUPPORT_LIBRARY})
      if (std::filesystem::exists(candidate, ec)) return candidate.lexically_normal().string();
  }
  return FAULTKEEP_SUPPORT_LIBRARY;
}

// The NAND info dictionary of the root's controller with the memory
// freezer's writes, as the daily collection would store them.
int Controller(const std::string& root) {
  platform::ContextScope scope(root.empty() ? platform::Context::Current().root() : root);
  if (const auto bad_root = CheckDeviceRoot("devsim")) return *bad_root;
  cf::Dictionary info;
  const cf::Value nand = CopyNANDInfo();
  if (const cf::Dictionary* d = nand.AsDictionary()) info = d->MutableCopy();
  for (const auto& [key, value] : CopyVMFreezerNANDInfo()) info.Set(key, value);
  std::printf("%s\n", tools::JSONText(info, 2).c_str());
  if (info.Contains("com.velmora.NANDInfo.Error")) {
    std::fprintf(stderr, "devsim: the controller of %s could not be read: %s\n", scope.context().root().c_str(),
                 GetAPIErrorMessage().c_str());
    return 1;
  }
  return 0;
}

// Every view a root's storage device gives: the three whitelisted sources,
// the health, lab and OTA views and the content-deletion answer.
int Views(const std::string& root, bool round) {
  platform::ContextScope scope(root.empty() ? platform::Context::Current().root() : root);
  if (const auto bad_root = CheckDeviceRoot("devsim")) return *bad_root;
  // The service prints some progress lines on standard output; while the
  // views are gathered they go to standard error, so the output is JSON.
  std::fflush(stdout);
  const int saved_stdout = dup(STDOUT_FILENO);
  dup2(STDERR_FILENO, STDOUT_FILENO);
  cf::Dictionary views;
  views.Set("FTL", CopyWhitelistedNANDFTLInfo(round));
  views.Set("MSP", CopyWhitelistedNANDMSPInfo(round));
  views.Set("StorageStats", CopyWhitelistedStorageStats(round));
  views.Set("Health", CopyHalvernNANDInfo());
  views.Set("InternalLab", CopyInternalLabNANDInfo());
  views.Set("OTA", CopyOTANANDInfo());
  views.Set("ContentDeletion", NandRecommendsContentDeletion());
  std::fflush(stdout);
  dup2(saved_stdout, STDOUT_FILENO);
  close(saved_stdout);
  std::printf("%s\n", tools::JSONText(views, 2).c_str());
  return 0;
}

// One channel's change between two samples, for --json.
cf::Dictionary ChannelDelta(const cf::Dictionary& sample) {
  cf::Dictionary out;
  out.Set("driver", IOReportChannelGetDriverName(sample));
  out.Set("driverID", cf::Value::SInt64(IOReportChannelGetDriverID(sample)));
  out.Set("group", IOReportChannelGetGroup(sample));
  out.Set("subgroup", IOReportChannelGetSubGroup(sample));
  out.Set("channel", IOReportChannelGetChannelName(sample));
  out.Set("channelID", cf::Value::SInt64(IOReportChannelGetChannelID(sample)));
  out.Set("categories", cf::Value::SInt64(IOReportChannelGetCategories(sample)));
  out.Set("unit", IOReportChannelGetUnitLabel(sample));
  cf::Array values;
  switch (IOReportChannelGetFormat(sample)) {
    case kIOReportFormatSimple:
      out.Set("format", "simple");
      out.Set("delta", cf::Value::SInt64(IOReportSimpleGetIntegerValue(sample, nullptr)));
      return out;
    case kIOReportFormatSimpleArray:
      out.Set("format", "array");
      for (int i = 0; IOReportArrayGetValueAtIndex(sample, i) != kIOReportInvalidValue; ++i)
        values.Append(cf::Value::SInt64(IOReportArrayGetValueAtIndex(sample, i)));
      break;
    case kIOReportFormatState:
      out.Set("format", "state");
      for (int i = 0; i < IOReportStateGetCount(sample); ++i) {
        cf::Dictionary state;
        state.Set("name", IOReportStateGetNameForIndex(sample, i));
        state.Set("transitions", cf::Value::SInt64(IOReportStateGetInTransitions(sample, i)));
        state.Set("residency", cf::Value::SInt64(IOReportStateGetResidency(sample, i)));
        values.Append(state);
      }
      break;
    case kIOReportFormatHistogram:
      out.Set("format", "histogram");
      for (int i = 0; i < IOReportHistogramGetBucketCount(sample); ++i) {
        cf::Dictionary bucket;
        bucket.Set("hits", cf::Value::SInt64(IOReportHistogramGetBucketHits(sample, i)));
        bucket.Set("sum", cf::Value::SInt64(IOReportHistogramGetBucketSum(sample, i)));
        values.Append(bucket);
      }
      break;
    default: out.Set("format", "unknown");
  }
  out.Set("delta", values);
  return out;
}

// The reporting channels of a root (all, or those of some categories) and
// what changed in them between two samples taken interval seconds apart:
// each channel's line, then its values indented; or the same as JSON. For
// people checking a device. Drivers whose legends cannot be read are named
// on stderr.
int Reporting(const std::string& root, int64_t categories, bool json, double interval) {
  platform::ContextScope scope(root.empty() ? platform::Context::Current().root() : root);
  if (const auto bad_root = CheckDeviceRoot("devsim")) return *bad_root;
  const std::string& where = scope.context().root();
  std::optional<IOReportError> error;
  const auto fail = [&](const char* what) {
    std::fprintf(stderr, "devsim: %s: %s: %s\n", where.c_str(), what,
                 error ? error->Description().c_str() : "no reason given");
    return 1;
  };
  const uint32_t options = kIOReportByDriver | kIOReportPrintFailedDrivers;
  const cf::Value channels = categories < 0 ? IOReportCopyAllChannels(options, &error)
                                            : IOReportCopyChannelsInCategories(static_cast<uint16_t>(categories),
                                                                               options, &error);
  if (channels.IsNull()) return fail("the reporting channels could not be listed");
  if (IOReportGetChannelCount(channels) == 0) {
    std::fprintf(stderr, "devsim: %s has no reporting channels%s\n", where.c_str(),
                 categories < 0 ? "" : " in those categories");
    return 1;
  }
  cf::Value subscribed;
  const IOReportSubscriptionRef subscription = IOReportCreateSubscription(nullptr, channels, &subscribed, 0, &error);
  if (!subscription) return fail("the reporting hub could not be subscribed to");
  const cf::Value first = IOReportCreateSamples(subscription, subscribed, &error);
  if (first.IsNull()) return fail("the reporting channels could not be sampled");
  std::this_thread::sleep_for(std::chrono::duration<double>(interval));
  const cf::Value second = IOReportCreateSamples(subscription, subscribed, &error);
  if (second.IsNull()) return fail("the reporting channels could not be sampled");
  const cf::Value delta = IOReportCreateSamplesDelta(first, second, &error);
  if (delta.IsNull()) return fail("the two samples could not be compared");
  if (json) {
    cf::Array out;
    IOReportIterate(delta, [&](const cf::Dictionary& sample) {
      out.Append(ChannelDelta(sample));
      return kIOReportIterOk;
    });
    std::printf("%s\n", tools::JSONText(out, 2).c_str());
    return std::fflush(stdout) == 0 ? 0 : 1;
  }
  IOReturn written = kIOReturnSuccess;
  IOReportIterate(delta, [&](const cf::Dictionary& sample) {
    for (const cf::Value& text :
         {IOReportChannelCopyDescription(sample, {}, ""), IOReportSampleCopyDescription(sample, {}, "  ")})
      if (!text.IsNull() && written == kIOReturnSuccess) written = IOReportWriteStringUTF8(STDOUT_FILENO, text);
    return written == kIOReturnSuccess ? kIOReportIterOk : kIOReportIterFailed;
  });
  return written == kIOReturnSuccess ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Simulated device tools"};
  app.require_subcommand(1);
  std::string dir;
  bool force = false;
  auto* init = app.add_subcommand("init", "Write a complete default device root into DIR");
  init->add_option("DIR", dir)->required();
  init->add_flag("--force", force, "replace the device root already in DIR: everything in it is removed first");
  bool host = false;
  init->add_flag("--host", host, "list this machine's disks as the storage controllers; simulate nothing else");
  std::string kind, file, header_file;
  auto* parse = app.add_subcommand("parse", "Parse a raw statistics buffer: one 'name value' line per pair");
  parse->add_option("KIND", kind, "ftl, stats or msp")->required()->check(CLI::IsMember({"ftl", "stats", "msp"}));
  parse->add_option("FILE", file)->required();
  std::string controller_root;
  auto* controller = app.add_subcommand("controller", "Print the NAND info a root's controller gives, as JSON");
  controller->add_option("ROOT", controller_root, "the device root (default: TALLYRUN_ROOT)");
  std::string views_root;
  bool round = false;
  auto* views = app.add_subcommand("views", "Print the analytics, health, lab and OTA views a root gives, as JSON");
  views->add_option("ROOT", views_root, "the device root (default: TALLYRUN_ROOT)");
  views->add_flag("--round", round, "round each field to its significant digits");
  std::string reporting_root;
  int64_t categories = -1;
  bool reporting_json = false;
  double interval = 1;
  auto* reporting =
      app.add_subcommand("ioreport", "Print a root's reporting channels and their change over a second");
  reporting->add_option("ROOT", reporting_root, "the device root (default: TALLYRUN_ROOT)");
  reporting->add_option("--category", categories, "only channels of these categories (a mask, e.g. 0x100)")
      ->check(CLI::Range(int64_t{0}, int64_t{0xFFFF}));
  reporting->add_flag("--json", reporting_json, "print the channels and their change as JSON");
  reporting->add_option("--interval", interval, "seconds between the two samples (default 1)")
      ->check(CLI::Range(0.0, 3600.0));
  auto* snapshot = app.add_subcommand("snapshot", "Print a snapshot buffer as text");
  snapshot->add_option("FILE", file)->required();
  snapshot->add_option("--header", header_file, "the snapshot header, for the descriptor-driven form");
  if (const auto status = ParseCommandLine(app, argc, argv)) return *status;
  if (parse->parsed()) return Parse(kind, file);
  if (snapshot->parsed()) return Snapshot(file, header_file);
  if (controller->parsed()) return Controller(controller_root);
  if (views->parsed()) return Views(views_root, round);
  if (reporting->parsed()) return Reporting(reporting_root, categories, reporting_json, interval);
  if (init->parsed()) {
    std::error_code ec;
    if (dir.empty()) {
      std::fprintf(stderr, "devsim: DIR is empty; name the directory to make the device root in\n");
      return 2;
    }
    if (platform::IsProtectedDirectory(dir)) {
      std::fprintf(stderr, "devsim: %s is never a device root; make one in a directory of its own\n", dir.c_str());
      return 2;
    }
    if (std::filesystem::exists(dir, ec) && !std::filesystem::is_directory(dir, ec)) {
      std::fprintf(stderr, "devsim: %s exists and is not a directory\n", dir.c_str());
      return 2;
    }
    if (!force && std::filesystem::exists(dir, ec) && !std::filesystem::is_empty(dir, ec)) {
      std::fprintf(stderr, "devsim: %s is not empty (use --force to replace the device root in it)\n", dir.c_str());
      return 2;
    }
    if (force && !ClearOldRoot(dir)) return 2;
    std::string error;
    const std::string where = std::filesystem::absolute(dir, ec).string();
    std::vector<std::string> disks;
    if (!(host ? WriteHostRoot(where, SupportLibrary(), &disks, &error)
               : WriteDefaultRoot(where, SupportLibrary(), &error))) {
      std::fprintf(stderr, "devsim: %s\n", error.c_str());
      return 1;
    }
    if (host && disks.empty()) std::fprintf(stderr, "devsim: this machine shows no disks in /sys/block\n");
    std::printf("%s\n", where.c_str());
  }
  return 0;
}
