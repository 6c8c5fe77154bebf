#include "driver/driver.h"
#include "cf/plist.h"
#include "platform/diagnostics.h"
#include "platform/log.h"

using platform::LogDefault;
using platform::LogError;
using platform::XPCEvent;

bool gAppInfoRequested = false;

namespace {
// The single turn of the first message that is not an app-data message.
bool gServiceTurnTaken = false;

// The first text field of an app record that a property list cannot carry,
// with the reason in *why.
const char* UncarriedText(const cf::Value& record, std::string* why) {
  for (const char* field : {"bundle_id", "version"}) {
    const cf::String* text = xpc_dictionary_get_string(record, field);
    if (text && !cf::IsPropertyListString(*text, why)) return field;
  }
  return nullptr;
}

}  // namespace

void HandleServiceConnection(const XPCEvent& event) {
  if (event.type != XPCEvent::Type::kConnection) return;
  xpc_connection_set_target_queue(event.connection);
  xpc_connection_set_event_handler(event.connection, HandleServiceMessage);
  xpc_connection_resume(event.connection);
}

cf::Value AppInfoEntryFromRecord(const cf::Value& record) {
  const cf::String* bundle = xpc_dictionary_get_string(record, "bundle_id");
  const cf::String* version = xpc_dictionary_get_string(record, "version");
  const auto uuid = xpc_dictionary_get_uuid(record, "uuid");
  if (!bundle || !version || !uuid) return {};
  cf::Dictionary entry;
  entry.Set("bundle", *bundle);
  entry.Set("version", *version);
  entry.Set("adamID", cf::Value::SInt64(xpc_dictionary_get_int64(record, "adam_id")));
  entry.Set("arch", cf::Value::SInt64(xpc_dictionary_get_int64(record, "arch")));
  entry.Set("uuid", uuid_unparse(*uuid));
  return entry;
}

void HandleServiceMessage(const XPCEvent& event) {
  if (event.type != XPCEvent::Type::kDictionary) return;
  const int32_t operation = static_cast<int32_t>(xpc_dictionary_get_int64(event.message, "operation"));
  if (operation == kOperationAppData) {
    cf::Array list;
    const cf::Value app_data = xpc_dictionary_get_value(event.message, "app_data");
    // A missing array counts as an empty list; incomplete records are skipped.
    if (const cf::Array* records = app_data.AsArray()) {
      for (const cf::Value& record : *records) {
        cf::Value entry = AppInfoEntryFromRecord(record);
        if (entry.IsNull()) {
          LogError("Skipping an app record without bundle_id, version or uuid");
          continue;
        }
        // The entry's text goes into the day's log: one string the log
        // cannot carry would cost the whole log, so the record goes instead.
        std::string why;
        if (const char* field = UncarriedText(record, &why)) {
          LogError("Skipping an app record whose %s a property list cannot carry (%s)", field, why);
          continue;
        }
        list.Append(entry);
      }
    }
    LogDefault("tallyrun got %sAAI:\n%@", gAppInfoRequested ? "requested" : "(unsolicited -- so ignoring) ",
               cf::Value(list));
    if (gAppInfoRequested) {
      RunDailyTasksIfDayChanged(list);
      gAppInfoRequested = false;
    }
    return;
  }
  if (gServiceTurnTaken) return;
  gServiceTurnTaken = true;
  if (operation == kOperationRunDay) {
    RunDailyTasks(static_cast<int32_t>(xpc_dictionary_get_int64(event.message, "value")), cf::Value());
  } else if (operation == kOperationLoggingStatus) {
    gAppInfoRequested = true;
    notify_post(kLoggingNotification);
    LogDefault("notified of logging status, waiting for activate app info");
  }
}
