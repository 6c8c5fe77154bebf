// Walking an aggregate: visiting, pruning and copying its channels level by
// level, filing channels into levels, and merging aggregates.
#include <array>

#include "ioreport/internal.h"
#include "ioreport/ioreport.h"

namespace ioreport_internal {

namespace {

constexpr const char* kChannels = "IOReportChannels";
constexpr const char* kDrivers = "IOReportDrivers";
constexpr const char* kGroups = "IOReportChannelGroups";
constexpr std::array<const char*, 2> kNestings = {kDrivers, kGroups};

// Aggregates come from our own building, but a merge takes whatever it is
// given; a nesting deeper than this is not an aggregate.
constexpr int kMaxDepth = 32;

enum class Mode { kVisit, kPrune, kCopy };

struct Walk {
  Mode mode;
  const IOReportChannelCallback* visit = nullptr;
  const CopyCallback* copy = nullptr;
};

int walkLevel(cf::Dictionary level, const Walk& walk, cf::Dictionary* copy, int depth) {
  if (depth > kMaxDepth) return kIOReportIterWalkFailed;
  int result = kIOReportIterOk;
  if (const cf::Value* value = level.Find(kChannels)) {
    const cf::Array* found = value->AsArray();
    if (!found) return kIOReportIterWalkFailed;
    for (const cf::Value& channel : *found)
      if (!channel.AsDictionary()) return kIOReportIterWalkFailed;
    cf::Array channels = *found;  // the level's own array: pruning edits it in place
    cf::Array kept;
    // Each channel present at the start is visited once, even when a callback
    // adds to the array it walks (a merge into an aggregate sharing levels).
    const size_t total = channels.size();
    size_t i = 0;
    for (size_t visited = 0; visited < total && i < channels.size(); ++visited) {
      const cf::Dictionary* entry = channels[i].AsDictionary();
      if (!entry) return kIOReportIterWalkFailed;  // a callback changed the level under us
      const cf::Dictionary channel = *entry;
      int r;
      if (walk.mode == Mode::kCopy) {
        cf::Dictionary duplicate = channel.MutableCopy();
        r = (*walk.copy)(channel, duplicate);
        if (r & kIOReportIterFailed) return r;
        if (r == kIOReportIterOk) kept.Append(duplicate);
      } else {
        r = (*walk.visit)(channel);
        if (r & kIOReportIterFailed) return r;
        if (walk.mode == Mode::kPrune && r == kIOReportIterSkipped) {
          channels.RemoveAt(i);
          result |= r;
          continue;
        }
      }
      result |= r;
      ++i;
    }
    if (walk.mode == Mode::kPrune && channels.empty()) level.Remove(kChannels);
    if (copy) copy->Set(kChannels, kept);
  }
  for (const char* nesting : kNestings) {
    const cf::Value* value = level.Find(nesting);
    if (!value) continue;
    const cf::Dictionary* found = value->AsDictionary();
    if (!found) return kIOReportIterWalkFailed;
    cf::Dictionary levels = *found;
    cf::Dictionary copied;
    // A copy: pruning removes entries as it goes.
    const std::vector<std::pair<cf::Value, cf::Value>> entries(levels.begin(), levels.end());
    for (const auto& [name, nested] : entries) {
      if (!name.AsString() || !nested.AsDictionary()) continue;
      cf::Dictionary nested_copy;
      const int r = walkLevel(*nested.AsDictionary(), walk, copy ? &nested_copy : nullptr, depth + 1);
      if (r & kIOReportIterFailed) return r;
      result |= r;
      if (walk.mode == Mode::kPrune && nested.AsDictionary()->empty()) levels.Remove(name);
      if (copy) copied.Set(name, nested_copy);
    }
    if (walk.mode == Mode::kPrune && levels.empty()) level.Remove(nesting);
    if (copy) copy->Set(nesting, copied);
  }
  return result;
}

int walkAggregate(const cf::Value& aggregate, const Walk& walk, cf::Dictionary* copy) {
  const cf::Dictionary* top = aggregate.AsDictionary();
  if (!top) return kIOReportIterWalkFailed;
  return walkLevel(*top, walk, copy, 0);
}

// One step down the nesting: level[nesting][name]. With create false it
// only checks that the path has the right types where it exists; *exists
// tells whether it does.
bool descend(cf::Dictionary& level, const char* nesting, const cf::Value& name, bool create, bool* exists) {
  cf::Dictionary holder;
  if (const cf::Value* v = level.Find(nesting)) {
    if (!v->AsDictionary()) return false;
    holder = *v->AsDictionary();
  } else if (create) {
    level.Set(nesting, holder);
  } else {
    *exists = false;
    return true;
  }
  if (const cf::Value* v = holder.Find(name)) {
    if (!v->AsDictionary()) return false;
    level = *v->AsDictionary();
    return true;
  }
  if (!create) {
    *exists = false;
    return true;
  }
  cf::Dictionary fresh;
  holder.Set(name, fresh);
  level = fresh;
  return true;
}

// The level the channel belongs in; checks first, then creates, so that a
// channel that cannot be filed leaves the aggregate as it was.
bool fileChannel(const cf::Dictionary& top, const cf::Dictionary& channel, uint32_t options, bool create,
                 cf::Dictionary* out) {
  cf::Dictionary level = top;
  bool exists = true;
  if (options & kIOReportByDriver) {
    const cf::Value& driver = channel.Get("DriverName");
    if (!driver.AsString()) return false;
    if (!descend(level, kDrivers, driver, create, &exists)) return false;
    if (!exists) return true;
  }
  const cf::Value& group = channel.Get("IOReportGroupName");
  if ((options & kIOReportByGroup) && group.AsString()) {
    if (!descend(level, kGroups, group, create, &exists)) return false;
    if (!exists) return true;
    const cf::Value& subgroup = channel.Get("IOReportSubGroupName");
    if (subgroup.AsString()) {
      if (!descend(level, kGroups, subgroup, create, &exists)) return false;
      if (!exists) return true;
    }
  }
  if (const cf::Value* v = level.Find(kChannels); v && !v->AsArray()) return false;
  *out = level;
  return true;
}

}  // namespace

IOReturn addChannel(const cf::Value& aggregate, const cf::Value& channel, uint32_t options) {
  const cf::Dictionary* top = aggregate.AsDictionary();
  const cf::Dictionary* entry = channel.AsDictionary();
  if (!top || !entry) return kIOReturnBadArgument;
  cf::Dictionary level;
  if (!fileChannel(*top, *entry, options, false, &level)) return kIOReturnError;
  if (!fileChannel(*top, *entry, options, true, &level)) return kIOReturnError;
  if (const cf::Value* v = level.Find(kChannels)) {
    cf::Array channels = *v->AsArray();
    channels.Append(channel);
  } else {
    level.Set(kChannels, cf::Array({channel}));
  }
  return kIOReturnSuccess;
}

cf::Value copyChannels(const cf::Value& aggregate, const CopyCallback& callback, int* result) {
  Walk walk{Mode::kCopy};
  walk.copy = &callback;
  cf::Dictionary copy;
  const int r = walkAggregate(aggregate, walk, &copy);
  if (result) *result = r;
  if (r & kIOReportIterFailed) return cf::Value();
  return copy;
}

}  // namespace ioreport_internal

using namespace ioreport_internal;

int IOReportIterate(const cf::Value& aggregate, const IOReportChannelCallback& callback) {
  Walk walk{Mode::kVisit};
  walk.visit = &callback;
  return walkAggregate(aggregate, walk, nullptr);
}

int IOReportPrune(const cf::Value& aggregate, const IOReportChannelCallback& callback) {
  Walk walk{Mode::kPrune};
  walk.visit = &callback;
  return walkAggregate(aggregate, walk, nullptr);
}

int IOReportGetChannelCount(const cf::Value& aggregate) {
  int count = 0;
  const int r = IOReportIterate(aggregate, [&count](const cf::Dictionary&) {
    ++count;
    return kIOReportIterOk;
  });
  return r == kIOReportIterOk ? count : -1;
}

int IOReportMergeChannels(const cf::Value& destination, const cf::Value& source, IOReportErrorOut error) {
  const cf::Dictionary* to = destination.AsDictionary();
  const cf::Dictionary* from = source.AsDictionary();
  if (!to || !from || to->SameAs(*from)) {
    setError(error, kIOReturnBadArgument, "bad argument");
    return kIOReportIterWalkFailed;
  }
  const uint32_t options = queryOptions(*to);
  IOReturn failure = kIOReturnSuccess;
  const int r = IOReportIterate(source, [&](const cf::Dictionary& channel) {
    failure = addChannel(destination, channel, options);
    return failure == kIOReturnSuccess ? kIOReportIterOk : kIOReportIterFailed;
  });
  if (failure != kIOReturnSuccess) setError(error, failure, "_addChannel() failed");
  return r;
}
