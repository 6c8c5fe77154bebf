// What the storage statistics service shows to others: the whitelisted views
// sent to the analytics service and their senders, the reference-map group
// events, the image driver's figures, and the health, lab and OTA views.
#pragma once

#include <cstdint>
#include <string_view>

#include "cf/value.h"

// The view sources; round applies each field's significant digits. Every
// source carries the last-error message under "ESR_APIErrorMessage".
cf::Value CopyWhitelistedNANDFTLInfo(bool round);
// MSP index text -> that MSP's view, plus "ESR_APIErrorMessage".
cf::Value CopyWhitelistedNANDMSPInfo(bool round);
cf::Value CopyWhitelistedStorageStats(bool round);
// The six derived figures the MSP and storage views share.
cf::Dictionary gatherVSPOtherData();

// The senders: the union of the payloads the analytics service accepted, or
// null. (createAndLogNANDFieldsToEventLens is declared in nandinfo.h.)
cf::Value createAndLogFTLFieldsToEventLensForEvent();
cf::Value createAndLogMSPFieldsToEventLensForEvent();
cf::Value createAndLogStorageStatsToEventLensForEvent();

// One group event's payload: each field's value from the TBKD dictionary (0
// when it has none), with the error texts and the three disk figures put in.
cf::Dictionary BuildGroupEventPayload(std::string_view groupName, const cf::Dictionary& group, const cf::Dictionary& tbkd,
                                      int64_t freezerBytes, int64_t capacityMB, int64_t freeMB);

// The image driver ("VelmoraNVMeEAN"): a four-character image key's size and
// update count, 0 on any failure.
struct EANConnection {
  uint32_t service = 0;
  uint32_t connection = 0;
};
bool getEANConnection(EANConnection* connection);
uint64_t GetEANImageSize(uint32_t key);
uint64_t GetEANUpdateCount(uint32_t key);

// Health views of the FTL statistics, for other clients on the device.
cf::Dictionary gatherNANDHealthInfo();
cf::Value CopyHalvernNANDInfo();
cf::Value CopyInternalLabNANDInfo();
cf::Value CopyOTANANDInfo();
// Whether the controller recommends deleting content: a boolean value.
cf::Value NandRecommendsContentDeletion();
