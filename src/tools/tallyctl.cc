// tallyctl: sends one message to the tallyrun service of TALLYRUN_ROOT, or
// shows a submitted log.

#include <cstdio>
#include <filesystem>
#include <limits>
#include <string>

#include "cf/plist.h"
#include "platform/store.h"
#include "tools/cli.h"
#include "platform/files.h"
#include "platform/service.h"
#include "tools/output.h"

namespace {

constexpr const char* kService = "com.velmora.tallybookd.tallyrun";

int Fail(int status, const std::string& message) {
  std::fprintf(stderr, "tallyctl: %s\n", message.c_str());
  return status;
}

// The app list of FILE: a JSON array of objects with "bundle_id", "version",
// "adam_id", "arch" and "uuid" (36-character text).
bool ReadAppData(const std::string& file, cf::Array* out, std::string* error) {
  const auto text = platform::ReadFile(file, error);
  if (!text) return false;
  const cf::ParseResult parsed = cf::ParseJSON(*text);
  if (!parsed.ok()) {
    *error = file + ": " + parsed.error;
    return false;
  }
  const cf::Array* apps = parsed.value.AsArray();
  if (!apps) {
    *error = file + ": expected a JSON array of app objects";
    return false;
  }
  size_t index = 0;
  for (const cf::Value& app : *apps) {
    const std::string where = file + ": app " + std::to_string(index++);
    const cf::Dictionary* d = app.AsDictionary();
    if (!d) {
      *error = where + " is not an object";
      return false;
    }
    cf::Dictionary record;
    for (const char* key : {"bundle_id", "version"}) {
      const cf::Value v = d->Get(key);
      if (!v.AsString()) {
        *error = where + ": \"" + key + "\" must be text";
        return false;
      }
      record.Set(key, v);
    }
    for (const char* key : {"adam_id", "arch"}) {
      const cf::Value v = d->Get(key);
      if (!v.AsNumber() || v.AsNumber()->IsFloat()) {
        *error = where + ": \"" + key + "\" must be an integer";
        return false;
      }
      record.Set(key, cf::Value::SInt64(v.AsNumber()->AsSInt64()));
    }
    const cf::Value uuid_text = d->Get("uuid");
    const auto uuid = uuid_text.AsString() ? uuid_parse(*uuid_text.AsString()) : std::nullopt;
    if (!uuid) {
      *error = where + ": \"uuid\" must be 36-character UUID text";
      return false;
    }
    record.Set("uuid", cf::Value::Bytes(cf::Data(uuid->begin(), uuid->end())));
    out->Append(record);
  }
  return true;
}

// A property list (a submitted log, a preference file) as indented JSON.
int Show(const std::string& file) {
  std::error_code ec;
  // A pipe or a device would never end, or never begin.
  if (!std::filesystem::is_regular_file(file, ec)) {
    const bool exists = std::filesystem::exists(file, ec);
    return Fail(2, exists ? file + " is not a regular file" : "no file " + file);
  }
  std::string error;
  const auto bytes = platform::ReadFile(file, &error);
  if (!bytes) return Fail(2, error);
  const cf::ParseResult parsed = cf::ParsePropertyList(*bytes);
  if (!parsed.ok()) return Fail(2, file + " is not a property list: " + parsed.error);
  std::printf("%s\n", tools::JSONText(parsed.value, 2).c_str());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Send one message to the tallyrun service of TALLYRUN_ROOT"};
  app.require_subcommand(1);
  int64_t operation = 0, value = 0;
  std::string file, day_text;
  auto* logging = app.add_subcommand("logging-status", "Announce that app information will follow (operation 0)");
  auto* run_day = app.add_subcommand("run-day", "Run the daily tasks for a day (operation 1)");
  run_day->add_option("DAY", day_text, "a day number or an ISO date (YYYY-MM-DD)")->required();
  auto* app_data = app.add_subcommand("app-data", "Deliver activated-app information from a JSON file (operation 2)");
  app_data->add_option("FILE", file)->required();
  auto* send = app.add_subcommand("send", "Send any operation code");
  send->add_option("OPERATION", operation)->required();
  auto* value_opt = send->add_option("--value", value, "the message's \"value\"");
  bool raw = false;
  send->add_flag("--raw", raw, "send an operation code the service does not know (it still takes the service's turn)");
  auto* show = app.add_subcommand("show", "Print a submitted log (a property list) as JSON");
  show->add_option("FILE", file)->required();
  if (const auto status = ParseCommandLine(app, argc, argv)) return *status;
  if (show->parsed()) return Show(file);
  int64_t day = 0;
  if (run_day->parsed()) {
    std::string error;
    const auto parsed = ParseDay(day_text, &error);
    if (!parsed) return Fail(2, error);
    if (*parsed < 0) return Fail(2, "a day before 1970-01-01 cannot be run: " + day_text);
    // The service takes a day as a signed 32-bit number and would cut a
    // larger one down to some other day.
    if (*parsed > std::numeric_limits<int32_t>::max())
      return Fail(2, "day " + day_text + " is beyond the last day the service can take (" +
                         std::to_string(std::numeric_limits<int32_t>::max()) + "); nothing was sent");
    // The service would truncate a larger number to 32 bits and run some
    // other day; a day after today has nothing to run yet.
    if (const int32_t today = TBDaysSince1970(); *parsed > today)
      return Fail(2, "day " + day_text + " is after today (day " + std::to_string(today) + "); nothing was sent");
    day = *parsed;
  }
  // The service acts on the first message other than app data and ignores
  // the rest: a mistyped code would use up its turn without a word.
  if (send->parsed() && !raw && (operation < 0 || operation > 2))
    return Fail(2, "operation " + std::to_string(operation) +
                       " is none the service knows (0 logging-status, 1 run-day, 2 app-data); it would still take "
                       "the service's one turn; give --raw to send it anyway");
  if (const auto status = CheckDeviceRoot("tallyctl")) return *status;

  cf::Dictionary message;
  if (logging->parsed()) {
    message.Set("operation", cf::Value::SInt64(0));
  } else if (run_day->parsed()) {
    message.Set("operation", cf::Value::SInt64(1));
    message.Set("value", cf::Value::SInt64(day));
  } else if (app_data->parsed()) {
    cf::Array apps;
    std::string error;
    if (!ReadAppData(file, &apps, &error)) return Fail(2, error);
    message.Set("operation", cf::Value::SInt64(2));
    message.Set("app_data", apps);
  } else {
    message.Set("operation", cf::Value::SInt64(operation));
    if (value_opt->count()) message.Set("value", cf::Value::SInt64(value));
  }
  std::string error;
  if (!platform::SendServiceMessage(kService, message, &error)) return Fail(1, error);
  return 0;
}
