// The storage statistics service's daily entry point and the figures it is
// built from: the NAND info dictionary for the store (TBKD), the views sent
// to the analytics service and the dictionary of derived figures (ESR).
#pragma once

#include <cstdint>

#include "cf/value.h"

// Option bit 0: on analytics days send the FTL views and the group events
// and return the analytics dictionary. Bit 1: testing, all views at once.
cf::Value CopyNANDInfoWithOptions(uint64_t options);
// The TBKD dictionary, or the two-key error dictionary.
cf::Value CopyNANDInfo();
// "ESR_Purgewell_totalPurgeable" and "ESR_Purgewell_totalNonPurgeable", when
// the purgeable-space service answers them.
cf::Dictionary getPurgewellInfo();
// The derived figures; ftl is gatherVSPFTLData's dictionary or null.
cf::Dictionary gatherVSPFTLOtherData(const cf::Value& ftl);
// The memory freezer's disk writes, from a stackshot: both keys, or empty.
cf::Dictionary CopyVMFreezerNANDInfo();

// Whether the day of `seconds` (since 1970, UTC days) is one on which the
// full views go to the analytics service, for the boot session whose id
// starts with `first`: the parity of its hex digit (any other character
// counting as even) must equal the parity of the day.
bool IsEventLensDay(char first, int64_t seconds);

// Views of the controller's statistics sent to the analytics service:
// selector 0 all three at once, 1 the FTL views, 2 the MSP view, 3 the
// storage statistics. The union of what was sent, or null.
cf::Value createAndLogNANDFieldsToEventLens(int selector);
// The reference map's group events for the TBKD dictionary and three disk
// figures.
void SendReferenceMapGroupEvents(const cf::Value& tbkd, int64_t freezerBytes, int64_t capacityMB, int64_t freeMB);
