// Finding the storage controller, connecting to it, and fetching its
// statistics buffers with tunnel commands. Each known controller kind is one
// record of nand_exporters; nothing else hard-codes a command code or a
// parser.
#pragma once

#include <cstdint>
#include <cstdlib>
#include <memory>

#include "cf/value.h"
#include "parsers/context.h"
#include "platform/iokit.h"

// The command codes of one statistics family: size phase, then data phase.
struct tunnel_selectors_t {
  uint32_t sizeCommand;
  uint32_t dataCommand;
};

const tunnel_selectors_t* VSPGetStatsSelectors();
const tunnel_selectors_t* VSPMSPGetStatsSelectors();
const tunnel_selectors_t* VSPGetDefectsListSelectors();
const tunnel_selectors_t* VSPGetTelemetryListSelectors();
const tunnel_selectors_t* VSPGetTaskSchedulerSelectors();
const tunnel_selectors_t* VSPGetSnapshotSelectors();
const tunnel_selectors_t* VSPGetSnapshotHeaderSelectors();
const tunnel_selectors_t* VSPGetBandStatsSelectors();

using SelectorGetter = const tunnel_selectors_t* (*)();

struct nand_exporter_t {
  const char* className;
  const char* propertyMatchKey;
  io_connect_t connection;
  io_service_t service;
  uint32_t contentDeletionMethod;  // 0xFFFFFFFF: none
  uint32_t sizeMethod;             // 0: not for tunnel commands
  uint32_t dataMethod;
  SelectorGetter getStatsSelectors;
  SelectorGetter getMSPStatsSelectors;  // null: no MSP statistics
  SelectorGetter getDefectsListSelectors;
  SelectorGetter getTelemetryListSelectors;
  SelectorGetter getTaskSchedulerSelectors;
  SelectorGetter getSnapshotSelectors;
  SelectorGetter getSnapshotHeaderSelectors;
  SelectorGetter getBandStatsSelectors;
  uint32_t (*parseBuffer)(VSPParseCxt*, const void*, uint32_t);
  void (*releaseContext)(VSPParseCxt*);
  uint32_t (*parseMSPBuffer)(GenericParserCxt*, const void*, uint32_t);  // null: no MSP statistics
  uint32_t (*parseFTLBuffer)(GenericParserCxt*, const void*, uint32_t);
  void (*releaseGenericContext)(GenericParserCxt*);
};

// The known kinds in search order, ended by a record with a null className.
// Process-global and writable: findNandExporterNew keeps the open
// connection in the record it returns until ReleaseIOInterfaces.
extern nand_exporter_t nand_exporters[];

// The 24-byte input of both phases of a tunnel command (little-endian on
// the wire; see executeTunnelCommand).
struct tunnel_command_t {
  uint32_t command;
  uint32_t phase;
  uint32_t index;
  uint32_t sizeHint;
  uint64_t bufferAddress;
};
static_assert(sizeof(tunnel_command_t) == 24);
// The record as it goes on the wire, little-endian whatever the layout.
void EncodeTunnelCommand(const tunnel_command_t& command, uint8_t out[24]);

struct VSPConnection {
  io_service_t service;
  io_connect_t connection;
  nand_exporter_t* exporter;
};

// A zero-filled heap buffer from a tunnel command, freed with free().
struct FreeDeleter {
  void operator()(void* p) const { std::free(p); }
};
using TunnelBuffer = std::unique_ptr<uint8_t, FreeDeleter>;

io_service_t findNandExporter(nand_exporter_t** exporter);
bool findNandExporterNew(nand_exporter_t** exporter);
void ReleaseIOInterfaces(nand_exporter_t exporter);
io_connect_t VNDConnect(nand_exporter_t** exporter);
void VNDDisconnect(io_connect_t connection);
bool openVSPConnection(VSPConnection* connection);
void closeVSPConnection(VSPConnection* connection);
// On success *buffer holds the data phase's bytes and *size their count
// (which may be less than the size phase announced).
bool executeTunnelCommand(io_connect_t connection, const nand_exporter_t* exporter,
                          const tunnel_selectors_t* selectors, tunnel_command_t* command, TunnelBuffer* buffer,
                          size_t* size);
bool gatherVSPStatsData(nand_exporter_t** exporter, VSPParseCxt* context);
// Field name -> unsigned 64-bit number, fetched once per process while the
// answer is not null.
cf::Value gatherVSPFTLData();
// MSP index text ("0" to "9") -> that MSP's field dictionary.
cf::Value gatherVSPMSPData();

namespace nandinfo::testing {
// Forgets the cached FTL dictionary and the table's open handles, as a new
// process would start.
void ResetControllerState();
}  // namespace nandinfo::testing
