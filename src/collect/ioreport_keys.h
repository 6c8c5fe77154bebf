// Reporting-channel keys: every simple channel of the field category as one
// scalar of today, "com.velmora.ioreport.<channel name>".
#pragma once

#include "cf/value.h"

// Pruning callback: keeps simple channels (0), prunes the rest (16).
int KeepSimpleChannels(const cf::Dictionary& channel);
// Iteration callback: sets the key of a simple channel's sample to its
// value (the no-value marker when the sample holds none); always 0.
int WriteSimpleChannelKey(const cf::Dictionary& sample);

// Step 6 of the daily collection: subscribe to the simple field channels,
// sample them once and write their keys. Ends quietly when there are no
// channels, no subscription or no samples.
void CollectReportingChannels();
