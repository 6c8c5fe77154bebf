// Pieces shared by the files of the reporting-channel client.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "cf/value.h"
#include "ioreport/ioreport.h"

namespace ioreport_internal {

// Fills the error out-parameter when it is given.
void setError(IOReportErrorOut error, IOReturn code, const std::string& reason = "");
// The same, unless an error is stored already.
void setErrorIfEmpty(IOReportErrorOut error, IOReturn code, const std::string& reason = "");

// The channel's type from its legend (element 1), when it can be read.
std::optional<uint64_t> channelType(const cf::Dictionary& channel);
// A number's 64 bits as stored (signed and unsigned alike).
std::optional<int64_t> numberBits(const cf::Value& v);
// The aggregate's "QueryOpts", 0 when absent.
uint32_t queryOptions(const cf::Dictionary& aggregate);

// A 64-bit ID as text: its bytes from the most significant down, zero bytes
// skipped, every other byte printable. None when no character results or a
// byte is not printable.
std::optional<std::string> renderIDAsText(uint64_t id);

// Whether the bytes are well-formed UTF-8 (shortest forms, no surrogates,
// nothing past U+10FFFF).
bool isUTF8(std::string_view text);

// Walks the services that match, one step per service. A step's non-zero
// answer ends the walk with it; a registry that changes under the walk ends
// it with kIOReturnRegistryChanged (the walk is not restarted).
IOReturn walkDrivers(const cf::Value& matching, const std::function<IOReturn(io_service_t)>& step);

// Files a channel dictionary into the aggregate under the options' nesting.
IOReturn addChannel(const cf::Value& aggregate, const cf::Value& channel, uint32_t options);

// A copying walk: the callback sees the channel and a mutable copy of it, and
// the copy goes into the result when the callback answers 0. The result keeps
// the nesting of the aggregate (without "QueryOpts"); null when the walk
// fails, with its code in *result.
using CopyCallback = std::function<int(const cf::Dictionary& channel, cf::Dictionary& copy)>;
cf::Value copyChannels(const cf::Value& aggregate, const CopyCallback& callback, int* result);

}  // namespace ioreport_internal
