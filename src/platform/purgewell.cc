#include "platform/purgewell.h"

#include "platform/context.h"
#include "platform/log.h"
#include "platform/profile.h"

bool platform::PurgewellAvailable() { return Context::Current().purgewell_available(); }

cf::Value PurgewellCopyItemizedPurgeableSpaceWithInfo(const cf::Value& request) {
  if (!platform::PurgewellAvailable() || !request.AsDictionary()) return {};
  const cf::Value answer = platform::ReadProfileValue("/device/purgeable.plist");
  if (answer.IsNull() || answer.AsDictionary()) return answer;
  platform::LogError("%s is %s, not a dictionary; the purgeable-space service answers nothing",
                     platform::Context::Current().Path("/device/purgeable.plist"),
                     cf::TypeNameWithArticle(answer.type()));
  return {};
}
