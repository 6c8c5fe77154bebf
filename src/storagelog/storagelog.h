// The storage structured log: the controller's write amplification, its
// diagnostic lists (band validity, telemetry, defects) sent to the
// structured-data log, and the "StorageStatus" log for submission, written
// at most once a week while the write amplification is high.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <optional>

#include "cf/value.h"

// Fetches and hands out every list the controller kind can give; false when
// the controller cannot be reached or a list or its handler failed.
bool DumpStorageStructuredLog(bool verbose);

// A list handler: the list's bytes, the controller characteristics and the
// controller kind's class name. False when the bytes cannot be read.
using StorageListHandler = bool (*)(const uint8_t* data, size_t size, const cf::Value& characteristics,
                                    std::string_view class_name);

bool ParseValidityList(const uint8_t* data, size_t size, const cf::Value& characteristics,
                       std::string_view class_name);
bool ParseDefectsList(const uint8_t* data, size_t size, const cf::Value& characteristics,
                      std::string_view class_name);

// The lists' readers, without effects. The values of each list number 0 to
// 15 in entry order (other numbers dropped), or nothing when the list has no
// entries or is shorter than it claims.
std::optional<std::array<cf::Array, 16>> ValidityValues(const uint8_t* data, size_t size);
// Hands each record of a defects list to each as it is read: its header,
// then one per entry that fits. False, with nothing handed on, when the
// header itself does not fit.
bool ForEachDefectRecord(const uint8_t* data, size_t size, const cf::Value& characteristics,
                         std::string_view class_name, const std::function<void(const cf::Dictionary&)>& each);

// The NAND info keys (without the version keys) added to target.
void DumpNANDInfo(cf::Dictionary& target);
// One "StorageStatus" log unless one was written in the last seven days.
void NLW_WriteLog(std::string_view bug_type, const cf::Value& values);
// The device's key for crash reports, or "error".
std::string GetFaultkeepKey();

namespace storagelog::testing {
// Sets what the last DumpStorageStructuredLog measured.
void SetWriteAmplification(double user, double intermediate, bool above_threshold);
}  // namespace storagelog::testing
