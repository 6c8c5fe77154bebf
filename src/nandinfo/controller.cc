#include "nandinfo/controller.h"

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "nandinfo/helpers.h"
#include "parsers/parsers.h"
#include "platform/context.h"
#include "platform/log.h"

namespace {

constexpr tunnel_selectors_t kStats{13, 13};
constexpr tunnel_selectors_t kMSPStats{221, 221};
constexpr tunnel_selectors_t kDefectsList{15, 15};
constexpr tunnel_selectors_t kTelemetryList{17, 17};
constexpr tunnel_selectors_t kTaskScheduler{39, 39};
constexpr tunnel_selectors_t kSnapshot{22, 22};
constexpr tunnel_selectors_t kSnapshotHeader{145, 145};
constexpr tunnel_selectors_t kBandStats{11, 11};

constexpr int kMaxMSPIndexes = 10;

// The cached FTL dictionary, one per context (a test's root is a process of
// its own).
struct FtlCache {
  uint64_t context = 0;
  bool filled = false;
  cf::Value dictionary;
};
FtlCache g_ftl_cache;


}  // namespace

const tunnel_selectors_t* VSPGetStatsSelectors() { return &kStats; }
const tunnel_selectors_t* VSPMSPGetStatsSelectors() { return &kMSPStats; }
const tunnel_selectors_t* VSPGetDefectsListSelectors() { return &kDefectsList; }
const tunnel_selectors_t* VSPGetTelemetryListSelectors() { return &kTelemetryList; }
const tunnel_selectors_t* VSPGetTaskSchedulerSelectors() { return &kTaskScheduler; }
const tunnel_selectors_t* VSPGetSnapshotSelectors() { return &kSnapshot; }
const tunnel_selectors_t* VSPGetSnapshotHeaderSelectors() { return &kSnapshotHeader; }
const tunnel_selectors_t* VSPGetBandStatsSelectors() { return &kBandStats; }

#define VSP_COMMON_GETTERS                                                                                    \
  &VSPGetDefectsListSelectors, &VSPGetTelemetryListSelectors, &VSPGetTaskSchedulerSelectors,                \
      &VSPGetSnapshotSelectors, &VSPGetSnapshotHeaderSelectors, &VSPGetBandStatsSelectors, &VSPParseBufferToCxt, \
      &VSPReleaseContext

nand_exporter_t nand_exporters[] = {
    {"VelmoraVNS3NVMeController", "Controller Characteristics", 0, 0, 0xFFFFFFFF, 9, 9, &VSPGetStatsSelectors,
     &VSPMSPGetStatsSelectors, VSP_COMMON_GETTERS, &VSPMSPParseBufferToCxt, &VSPFTLParseBufferToCxt,
     &ReleaseGenericParserCxt},
    {"VelmoraEmbeddedNVMeController", "Controller Characteristics", 0, 0, 0xFFFFFFFF, 9, 9, &VSPGetStatsSelectors,
     nullptr, VSP_COMMON_GETTERS, nullptr, &VSPFTLParseBufferToCxt, &ReleaseGenericParserCxt},
    {"VSPStorage", "IOPropertyMatch", 0, 0, 5, 8, 8, &VSPGetStatsSelectors, nullptr, VSP_COMMON_GETTERS, nullptr,
     &VSPFTLParseBufferToCxt, &ReleaseGenericParserCxt},
    {},
};

#undef VSP_COMMON_GETTERS

namespace {
// The terminating record, where a search that found nothing points.
nand_exporter_t* Terminator() {
  nand_exporter_t* e = nand_exporters;
  while (e->className) ++e;
  return e;
}
}  // namespace

io_service_t findNandExporter(nand_exporter_t** exporter) {
  for (nand_exporter_t* e = nand_exporters; e->className; ++e) {
    const io_service_t service = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching(e->className));
    if (!service) continue;
    platform::LogDefault("NANDInfo: findNandExporter: Controller found: %s", e->className);
    if (exporter) *exporter = e;
    return service;
  }
  if (exporter) *exporter = Terminator();
  return 0;
}

bool findNandExporterNew(nand_exporter_t** exporter) {
  for (nand_exporter_t* e = nand_exporters; e->className; ++e) {
    const io_service_t service = IOServiceGetMatchingService(kIOMainPortDefault, IOServiceMatching(e->className));
    if (!service) continue;
    io_connect_t connection = 0;
    if (IOServiceOpen(service, mach_task_self(), 0, &connection) != kIOReturnSuccess) {
      IOObjectRelease(service);
      continue;
    }
    std::printf("NANDInfo_quill: findNandExporterNew: Controller found: %s\n", e->className);
    std::fflush(stdout);
    e->connection = connection;
    e->service = service;
    if (exporter) *exporter = e;
    return true;
  }
  if (exporter) *exporter = Terminator();
  return false;
}

void ReleaseIOInterfaces(nand_exporter_t exporter) {
  if (exporter.connection) IOServiceClose(exporter.connection);
  if (exporter.service) IOObjectRelease(exporter.service);
}

io_connect_t VNDConnect(nand_exporter_t** exporter) {
  nand_exporter_t* found = nullptr;
  const io_service_t service = findNandExporter(&found);
  if (exporter) *exporter = found;
  if (!service) {
    std::fputs("No class found", stderr);
    return 0;
  }
  io_connect_t connection = 0;
  const kern_return_t rc = IOServiceOpen(service, mach_task_self(), 0, &connection);
  if (rc != kIOReturnSuccess) {
    std::fprintf(stderr, "IOServiceOpen failed for class '%s', result 0x%x\n", found->className,
                 static_cast<unsigned>(rc));
    connection = 0;
  }
  IOObjectRelease(service);
  return connection;
}

void VNDDisconnect(io_connect_t connection) {
  if (IOServiceClose(connection) != kIOReturnSuccess) std::fputs("closing connection to service failed\n", stderr);
}

bool openVSPConnection(VSPConnection* c) {
  if (!c) return false;
  nand_exporter_t* exporter = nullptr;
  c->service = findNandExporter(&exporter);
  c->exporter = exporter;
  if (!c->service) {
    std::fputs("Can't get VSP Connection, no matching service!\n", stderr);
    closeVSPConnection(c);
    return false;
  }
  c->connection = VNDConnect(&exporter);
  c->exporter = exporter;
  if (!c->connection || !exporter || exporter->getStatsSelectors != &VSPGetStatsSelectors) {
    std::fputs("Can't get VSP Connection!\n", stderr);
    closeVSPConnection(c);
    return false;
  }
  return true;
}

void closeVSPConnection(VSPConnection* c) {
  if (!c) return;
  if (c->connection) IOServiceClose(c->connection);
  if (c->service) IOObjectRelease(c->service);
  c->connection = 0;
  c->service = 0;
}

void EncodeTunnelCommand(const tunnel_command_t& command, uint8_t out[24]) {
  // Little-endian hosts only: the words go out in host order.
  std::memcpy(out, &command.command, 4);
  std::memcpy(out + 4, &command.phase, 4);
  std::memcpy(out + 8, &command.index, 4);
  std::memcpy(out + 12, &command.sizeHint, 4);
  std::memcpy(out + 16, &command.bufferAddress, 8);
}

bool executeTunnelCommand(io_connect_t connection, const nand_exporter_t* exporter,
                          const tunnel_selectors_t* selectors, tunnel_command_t* command, TunnelBuffer* buffer,
                          size_t* size) {
  if (!command || !buffer || !size) return false;
  command->sizeHint = 0;
  command->bufferAddress = 0;
  if (!connection) {
    SetAPIErrorMessage("executeTunnelCommand: Invalid connection");
    return false;
  }
  if (!exporter || !exporter->sizeMethod || !exporter->dataMethod) {
    SetAPIErrorMessage("executeTunnelCommand: Invalid exporter");
    return false;
  }
  command->sizeHint = static_cast<uint32_t>(*size);
  command->bufferAddress = reinterpret_cast<uint64_t>(buffer);
  uint8_t input[24];
  auto encode = [&] { EncodeTunnelCommand(*command, input); };
  const size_t input_size = selectors ? sizeof input : 0;
  if (selectors) {
    command->command = selectors->sizeCommand;
    command->phase = 1;
    encode();
  }
  uint32_t announced = 0;
  size_t announced_size = sizeof announced;
  if (IOConnectCallStructMethod(connection, exporter->sizeMethod, input_size ? input : nullptr, input_size, &announced,
                                &announced_size) != kIOReturnSuccess) {
    SetAPIErrorMessage("executeTunnelCommand: IOConnectCallStructMethod failed while retrieving data size");
    buffer->reset();
    *size = 0;
    return false;
  }
  // calloc leaves untouched pages unmapped, so a large announced size costs
  // only what the data phase fills.
  TunnelBuffer data(static_cast<uint8_t*>(std::calloc(announced ? announced : 1, 1)));
  if (!data) {
    SetAPIErrorMessage("executeTunnelCommand: Could not allocate buffer");
    return false;
  }
  if (selectors) {
    command->command = selectors->dataCommand;
    command->phase = 0;
    encode();
  }
  size_t returned = announced;
  if (IOConnectCallStructMethod(connection, exporter->dataMethod, input_size ? input : nullptr, input_size, data.get(),
                                &returned) != kIOReturnSuccess) {
    SetAPIErrorMessage("executeTunnelCommand: IOConnectCallStructMethod failed while retrieving data");
    return false;
  }
  *buffer = std::move(data);
  *size = returned;
  return true;
}

bool gatherVSPStatsData(nand_exporter_t** exporter, VSPParseCxt* context) {
  nand_exporter_t* e = nullptr;
  const io_service_t service = findNandExporter(&e);
  if (exporter) *exporter = e;
  if (!service) {
    std::fputs("Could not get matching IOKit service for exporting classes\n", stderr);
    return false;
  }
  io_connect_t connection = 0;
  if (IOServiceOpen(service, mach_task_self(), 0, &connection) != kIOReturnSuccess) {
    std::fputs("Could not get connection to service\n", stderr);
    IOObjectRelease(service);
    return false;
  }
  tunnel_command_t command{};
  TunnelBuffer buffer;
  size_t size = 0;
  bool ok = executeTunnelCommand(connection, e, e->getStatsSelectors(), &command, &buffer, &size) &&
            e->parseBuffer(context, buffer.get(), static_cast<uint32_t>(size)) != 0;
  if (IOServiceClose(connection) != kIOReturnSuccess) {
    std::fputs("Could not close connection to service\n", stderr);
    ok = false;
  }
  IOObjectRelease(service);
  return ok;
}

cf::Value gatherVSPFTLData() {
  const uint64_t context = platform::Context::Current().id();
  if (g_ftl_cache.context != context) g_ftl_cache = FtlCache{context, false, cf::Value()};
  if (g_ftl_cache.filled && !g_ftl_cache.dictionary.IsNull()) return g_ftl_cache.dictionary;

  nand_exporter_t* e = nullptr;
  if (!findNandExporterNew(&e)) {
    SetAPIErrorMessage("gatherVSPFTLData: Could not get nand_exporter_t");
    return {};
  }
  if (!e->connection) {
    SetAPIErrorMessage("gatherVSPFTLData: No io_connection exist");
    return {};
  }
  cf::Value result;
  tunnel_command_t command{};
  TunnelBuffer buffer;
  size_t size = 0;
  if (executeTunnelCommand(e->connection, e, e->getStatsSelectors(), &command, &buffer, &size)) {
    GenericParserCxt parsed;
    if (!e->parseFTLBuffer(&parsed, buffer.get(), static_cast<uint32_t>(size)))
      SetAPIErrorMessage("gatherVSPFTLData: parseFTL failed");
    else
      result = CreateDictFromCxt(parsed);
    if (e->releaseGenericContext) e->releaseGenericContext(&parsed);
  }
  buffer.reset();
  ReleaseIOInterfaces(*e);
  g_ftl_cache.filled = true;
  g_ftl_cache.dictionary = result;
  return result;
}

cf::Value gatherVSPMSPData() {
  nand_exporter_t* e = nullptr;
  if (!findNandExporterNew(&e)) {
    SetAPIErrorMessage("gatherVSPMSPData: Could not get nand_exporter_t");
    return {};
  }
  if (!e->getMSPStatsSelectors || !e->parseMSPBuffer) {
    SetAPIErrorMessage("gatherVSPMSPData: Controller does not support MSP data");
    ReleaseIOInterfaces(*e);
    return {};
  }
  if (!e->connection) {
    SetAPIErrorMessage("gatherVSPMSPData: No io_connection exist");
    return {};
  }
  auto fetch = [&](uint32_t index, TunnelBuffer* buffer, size_t* size) {
    tunnel_command_t command{};
    command.index = index;
    *size = 0;
    return executeTunnelCommand(e->connection, e, e->getMSPStatsSelectors(), &command, buffer, size);
  };
  // First count the MSPs that answer; their buffers are fetched again below.
  int count = 0;
  for (; count < kMaxMSPIndexes; ++count) {
    TunnelBuffer probe;
    size_t size = 0;
    if (!fetch(static_cast<uint32_t>(count), &probe, &size)) break;
  }
  if (count == 0) SetAPIErrorMessage("CopyWhitelistedNANDMSPInfo: Unable to gather any NAND MSP fields");
  cf::Dictionary result;
  std::vector<GenericParserCxt> contexts(static_cast<size_t>(count));
  for (int i = 0; i < count; ++i) {
    TunnelBuffer buffer;
    size_t size = 0;
    if (!fetch(static_cast<uint32_t>(i), &buffer, &size)) {
      SetAPIErrorMessage("gatherVSPMSPData: getNANDMSPBuffer tunnel command failed !");
      break;
    }
    if (!e->parseMSPBuffer(&contexts[static_cast<size_t>(i)], buffer.get(), static_cast<uint32_t>(size))) {
      SetAPIErrorMessage("gatherVSPMSPData: parseMSP failed !");
      break;
    }
    result.Set(std::to_string(i), CreateDictFromCxt(contexts[static_cast<size_t>(i)]));
    e->releaseGenericContext(&contexts[static_cast<size_t>(i)]);
  }
  ReleaseIOInterfaces(*e);
  return result;
}

void nandinfo::testing::ResetControllerState() {
  g_ftl_cache = FtlCache{};
  for (nand_exporter_t* e = nand_exporters; e->className; ++e) {
    e->connection = 0;
    e->service = 0;
  }
}
