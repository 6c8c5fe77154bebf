// Finding the drivers that publish a legend, turning legends into channel
// dictionaries, and selecting channels.
#include <cstdio>

#include "cf/format.h"
#include "ioreport/internal.h"
#include "ioreport/ioreport.h"

namespace ioreport_internal {

IOReturn walkDrivers(const cf::Value& matching, const std::function<IOReturn(io_service_t)>& step) {
  io_iterator_t iterator = 0;
  if (const IOReturn rc = IOServiceGetMatchingServices(kIOMainPortDefault, matching, &iterator); rc != kIOReturnSuccess)
    return rc;
  IOReturn result = kIOReturnSuccess;
  while (IOIteratorIsValid(iterator)) {
    const io_service_t service = IOIteratorNext(iterator);
    if (!service) break;
    result = step(service);
    IOObjectRelease(service);
    if (result != kIOReturnSuccess) break;
  }
  if (result == kIOReturnSuccess && !IOIteratorIsValid(iterator)) result = kIOReturnRegistryChanged;
  IOObjectRelease(iterator);
  return result;
}

}  // namespace ioreport_internal

using namespace ioreport_internal;

namespace {

cf::Value newChannel(uint64_t driverID, const cf::Value& driverName, const cf::Value& legendChannel,
                     const cf::Value& group, const cf::Value& subgroup, const cf::Value& info) {
  cf::Dictionary channel;
  channel.Set("DriverID", cf::Value::SInt64(static_cast<int64_t>(driverID)));
  if (driverName.AsString()) channel.Set("DriverName", driverName);
  channel.Set("LegendChannel", legendChannel);
  if (group.AsString()) channel.Set("IOReportGroupName", group);
  if (subgroup.AsString()) channel.Set("IOReportSubGroupName", subgroup);
  if (info.AsDictionary()) channel.Set("IOReportChannelInfo", info);
  return channel;
}

// Lists every channel and keeps those the predicate keeps.
cf::Value copySelected(uint32_t options, IOReportErrorOut error, const IOReportChannelCallback& keep) {
  cf::Value all = IOReportCopyAllChannels(options, error);
  if (all.IsNull()) return all;
  if (IOReportPrune(all, keep) & kIOReportIterFailed) {
    setError(error, kIOReturnError, "channel pruning failed");
    return cf::Value();
  }
  return all;
}

bool sameString(const cf::Value& a, const cf::Value& b) { return a.AsString() && b.AsString() && a == b; }

}  // namespace

IOReturn addLegendChannels(const cf::Value& aggregate, const cf::Value& legend, uint64_t driverID,
                           const cf::Value& driverName, IOReportErrorOut error) {
  const cf::Array* entries = legend.AsArray();
  if (!entries) {
    setError(error, kIOReturnBadLegend, "bad legend");
    return kIOReturnBadLegend;
  }
  const cf::Dictionary* top = aggregate.AsDictionary();
  if (!top) {
    setError(error, kIOReturnBadArgument, "bad argument");
    return kIOReturnBadArgument;
  }
  const uint32_t options = queryOptions(*top);
  for (const cf::Value& value : *entries) {
    // A malformed entry ends the legend; what came before it stays.
    const cf::Dictionary* entry = value.AsDictionary();
    if (!entry) break;
    const cf::Value group = entry->Get("IOReportGroupName").AsString() ? entry->Get("IOReportGroupName") : cf::Value();
    const cf::Value subgroup =
        entry->Get("IOReportSubGroupName").AsString() ? entry->Get("IOReportSubGroupName") : cf::Value();
    if (!subgroup.IsNull() && group.IsNull()) break;
    const cf::Value info =
        entry->Get("IOReportChannelInfo").AsDictionary() ? entry->Get("IOReportChannelInfo") : cf::Value();
    const cf::Array* channels = entry->Get("IOReportChannels").AsArray();
    if (!channels) break;
    for (const cf::Value& legendChannel : *channels) {
      const cf::Array* numbers = legendChannel.AsArray();
      if (!numbers) break;
      // A channel is made only from a numeric ID and type.
      if (numbers->size() < 2 || !(*numbers)[0].AsNumber() || !(*numbers)[1].AsNumber()) {
        setError(error, kIOReturnError, "couldn't create channel");
        return kIOReturnError;
      }
      const cf::Value channel = newChannel(driverID, driverName, legendChannel, group, subgroup, info);
      if (addChannel(aggregate, channel, options) != kIOReturnSuccess) {
        setError(error, kIOReturnError, "_addChannel() failed");
        return kIOReturnError;
      }
    }
  }
  return kIOReturnSuccess;
}

cf::Value IOReportCopyDriverName(io_service_t driver) {
  char name[128];
  uint64_t id = 0;
  if (IORegistryEntryGetName(driver, name) != kIOReturnSuccess) return cf::Value();
  if (IORegistryEntryGetRegistryEntryID(driver, &id) != kIOReturnSuccess) return cf::Value();
  return cf::Format("%s <id %#llx>", name, id);
}

cf::Value IOReportCopyChannelsForDriver(io_service_t driver, uint32_t options, IOReportErrorOut error) {
  if (!driver || IOObjectRetain(driver) != kIOReturnSuccess) {
    setError(error, kIOReturnBadArgument, "invalid driver");
    return cf::Value();
  }
  IOObjectRelease(driver);
  cf::Value aggregate = IOReportCreateAggregate(options);
  if (IORegistryEntryCreateCFProperty(driver, "IOReportLegendPublic").IsNull()) return aggregate;
  const cf::Value legend = IORegistryEntryCreateCFProperty(driver, "IOReportLegend");
  if (legend.IsNull()) {
    setError(error, kIOReturnNotFound, "no legend");
    return cf::Value();
  }
  if (!legend.AsArray()) {
    setError(error, kIOReturnBadLegend, "bad legend");
    return cf::Value();
  }
  uint64_t id = 0;
  if (IORegistryEntryGetRegistryEntryID(driver, &id) != kIOReturnSuccess) {
    setError(error, kIOReturnError, "error extracting driver info");
    return cf::Value();
  }
  if (addLegendChannels(aggregate, legend, id, IOReportCopyDriverName(driver), error) != kIOReturnSuccess)
    return cf::Value();
  return aggregate;
}

cf::Value IOReportCopyAllChannels(uint32_t options, IOReportErrorOut error) {
  cf::Dictionary properties;
  properties.Set("IOReportLegendPublic", cf::Value::Bool(true));
  cf::Dictionary matching;
  matching.Set("IOPropertyMatch", properties);
  cf::Value result = IOReportCreateAggregate(options);
  bool merge_failed = false;
  const IOReturn rc = walkDrivers(matching, [&](io_service_t driver) -> IOReturn {
    std::optional<IOReportError> failure;
    const cf::Value channels = IOReportCopyChannelsForDriver(driver, options, &failure);
    if (channels.IsNull()) {
      if (options & kIOReportPrintFailedDrivers) {
        cf::Value name = IOReportCopyDriverName(driver);
        if (name.IsNull()) name = cf::Value("<unknown> function");
        const std::string line =
            !failure ? cf::Format("%@: %s\n", name, "<unknown> error")
                     : cf::Format("%@: %@\n", name,
                                  cf::Value(failure->failure_reason.empty() ? failure->Description()
                                                                            : failure->failure_reason));
        std::fputs(line.c_str(), stderr);
      }
      return kIOReturnSuccess;
    }
    if (IOReportMergeChannels(result, channels, error) & kIOReportIterFailed) {
      merge_failed = true;
      return kIOReturnError;
    }
    return kIOReturnSuccess;
  });
  if (merge_failed) return cf::Value();
  if (rc != kIOReturnSuccess) {
    setError(error, rc);
    return cf::Value();
  }
  return result;
}

cf::Value IOReportCopyChannelsForDrivers(const cf::Value& matching, uint32_t options, IOReportErrorOut error) {
  if (!matching.AsDictionary()) {
    setError(error, kIOReturnBadArgument, "no matching dict");
    return cf::Value();
  }
  cf::Value result = IOReportCreateAggregate(options);
  std::string reason;
  const IOReturn rc = walkDrivers(matching, [&](io_service_t driver) -> IOReturn {
    std::optional<IOReportError> failure;
    const cf::Value channels = IOReportCopyChannelsForDriver(driver, 0, &failure);
    if (channels.IsNull() || (IOReportMergeChannels(result, channels, &failure) & kIOReportIterFailed)) {
      if (failure) reason = failure->failure_reason;
      return kIOReturnError;
    }
    return kIOReturnSuccess;
  });
  if (rc != kIOReturnSuccess) {
    setError(error, rc, reason);
    return cf::Value();
  }
  return result;
}

cf::Value IOReportCopyChannelsWithID(const cf::Value& matching, int64_t channelID, IOReportErrorOut error) {
  if (!matching.AsDictionary()) {
    setError(error, kIOReturnBadArgument, "no matching dict");
    return cf::Value();
  }
  cf::Value result = IOReportCreateAggregate(0);
  const IOReturn rc = walkDrivers(matching, [&](io_service_t driver) -> IOReturn {
    uint64_t id = 0;
    if (IORegistryEntryGetRegistryEntryID(driver, &id) != kIOReturnSuccess) return kIOReturnError;
    const cf::Value legend = cf::Array({cf::Value::SInt64(channelID), cf::Value::SInt64(0)});
    const cf::Value channel = newChannel(id, IOReportCopyDriverName(driver), legend, {}, {}, {});
    return addChannel(result, channel, 0);
  });
  if (rc != kIOReturnSuccess) {
    setError(error, rc, rc == kIOReturnRegistryChanged ? "" : "_addChannel() failed");
    return cf::Value();
  }
  return result;
}

IOReturn IOReportAddChannelDescription(const cf::Value& aggregate, uint64_t driverID, const cf::Value& driverName,
                                       int64_t channelID, int64_t channelType, const cf::Value& channelName,
                                       const cf::Value& group, const cf::Value& subgroup, const cf::Value& info,
                                       IOReportErrorOut error) {
  const cf::Dictionary* top = aggregate.AsDictionary();
  if (!top) {
    // The add itself refuses what is not an aggregate.
    setError(error, kIOReturnBadArgument, "_addChannel() failed");
    return kIOReturnBadArgument;
  }
  cf::Array legend({cf::Value::SInt64(channelID), cf::Value::SInt64(channelType)});
  if (channelName.AsString()) legend.Append(channelName);
  const cf::Value channel = newChannel(driverID, driverName, legend, group, subgroup, info);
  if (const IOReturn rc = addChannel(aggregate, channel, queryOptions(*top)); rc != kIOReturnSuccess) {
    setError(error, rc, "_addChannel() failed");
    return rc;
  }
  return kIOReturnSuccess;
}

cf::Value IOReportCopyChannelsInCategories(uint16_t categories, uint32_t options, IOReportErrorOut error) {
  return copySelected(options, error, [categories](const cf::Dictionary& channel) {
    return (IOReportChannelGetCategories(channel) & categories) ? kIOReportIterOk : kIOReportIterSkipped;
  });
}

cf::Value IOReportCopyChannelsOfFormat(uint8_t format, uint32_t options, IOReportErrorOut error) {
  return copySelected(options, error, [format](const cf::Dictionary& channel) {
    return IOReportChannelGetFormat(channel) == format ? kIOReportIterOk : kIOReportIterSkipped;
  });
}

cf::Value IOReportCopyChannelsWithUnit(uint64_t unit, uint32_t options, IOReportErrorOut error) {
  return copySelected(options, error, [unit](const cf::Dictionary& channel) {
    return static_cast<uint64_t>(IOReportChannelGetUnit(channel)) == unit ? kIOReportIterOk : kIOReportIterSkipped;
  });
}

int IOReportSelectChannelsInGroup(const cf::Value& aggregate, const cf::Value& group, const cf::Value& subgroup,
                                  IOReportErrorOut error) {
  const bool by_group = group.AsString() != nullptr;
  const bool by_subgroup = subgroup.AsString() != nullptr;
  if (!by_group && !by_subgroup) {
    setError(error, kIOReturnBadArgument, "no group or subgroup!");
    return kIOReportIterFailed;
  }
  const int r = IOReportPrune(aggregate, [&](const cf::Dictionary& channel) {
    if (by_group && !sameString(IOReportChannelGetGroup(channel), group)) return kIOReportIterSkipped;
    if (by_subgroup && !sameString(IOReportChannelGetSubGroup(channel), subgroup)) return kIOReportIterSkipped;
    return kIOReportIterOk;
  });
  if (r & kIOReportIterFailed) setError(error, kIOReturnError, "channel pruning failed");
  return r;
}

cf::Value IOReportCopyChannelsInGroup(const cf::Value& group, const cf::Value& subgroup, uint32_t options,
                                      IOReportErrorOut error) {
  cf::Value all = IOReportCopyAllChannels(options, error);
  if (all.IsNull()) return all;
  if (IOReportSelectChannelsInGroup(all, group, subgroup, error) & kIOReportIterFailed) return cf::Value();
  return all;
}
