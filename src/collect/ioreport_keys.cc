#include "collect/ioreport_keys.h"

#include "cf/format.h"
#include "ioreport/ioreport.h"
#include "ioreport/samples.h"
#include "platform/store.h"

int KeepSimpleChannels(const cf::Dictionary& channel) {
  return IOReportChannelGetFormat(channel) == kIOReportFormatSimple ? kIOReportIterOk : kIOReportIterSkipped;
}

int WriteSimpleChannelKey(const cf::Dictionary& sample) {
  if (IOReportChannelGetFormat(sample) != kIOReportFormatSimple) return kIOReportIterOk;
  const std::string key = cf::Format("com.velmora.ioreport.%@", cf::Value(IOReportChannelGetChannelName(sample)));
  TBClientSetValueForScalarKey(key, IOReportSimpleGetIntegerValue(sample, nullptr));
  return kIOReportIterOk;
}

void CollectReportingChannels() {
  const cf::Value channels = IOReportCopyChannelsInCategories(kIOReportCategoryField, kIOReportByDriver, nullptr);
  if (channels.IsNull()) return;
  IOReportPrune(channels, KeepSimpleChannels);
  cf::Value subscribed;
  const IOReportSubscriptionRef subscription = IOReportCreateSubscription(nullptr, channels, &subscribed, 0, nullptr);
  if (!subscription) return;
  const cf::Value samples = IOReportCreateSamples(subscription, subscribed, nullptr);
  if (!samples.IsNull()) IOReportIterate(samples, WriteSimpleChannelKey);
}
