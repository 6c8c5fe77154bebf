#include <set>

#include "sim/device.h"
#include "sim/user_clients.h"

namespace sim {

namespace {

bool Fail(std::string* error, size_t index, const std::string& why) {
  if (error) *error = "service " + std::to_string(index) + ": " + why;
  return false;
}

std::optional<uint64_t> EntryID(const cf::Value& v) {
  const cf::Number* n = v.AsNumber();
  if (!n || n->IsFloat()) return std::nullopt;
  const int64_t signed_value = n->AsSInt64();
  if (n->AsUInt64() == 0 || (signed_value < 0 && !n->IsUnsigned())) return std::nullopt;
  return n->AsUInt64();
}

bool ReadService(const cf::Value& entry, size_t index, Service* out, std::string* error) {
  const cf::Dictionary* d = entry.AsDictionary();
  if (!d) return Fail(error, index, "not a dictionary");
  const cf::String* class_name = d->Get("class").AsString();
  if (!class_name || class_name->empty()) return Fail(error, index, "\"class\" must be a non-empty string");
  out->class_name = *class_name;
  const cf::Value& name = d->Get("name");
  if (!name.IsNull() && !name.AsString()) return Fail(error, index, "\"name\" must be a string");
  out->name = name.AsString() ? *name.AsString() : *class_name;
  const auto id = EntryID(d->Get("id"));
  if (!id) return Fail(error, index, "\"id\" must be a positive integer");
  out->id = *id;
  if (!d->Get("parent").IsNull()) {
    const auto parent = EntryID(d->Get("parent"));
    if (!parent) return Fail(error, index, "\"parent\" must be a positive integer");
    out->parent = *parent;
  }
  const cf::Value& properties = d->Get("properties");
  if (!properties.IsNull() && !properties.AsDictionary())
    return Fail(error, index, "\"properties\" must be a dictionary");
  if (properties.AsDictionary()) out->properties = *properties.AsDictionary();
  const cf::Value& kind = d->Get("userClient");
  if (!kind.IsNull() && !kind.AsString()) return Fail(error, index, "\"userClient\" must be a string");
  if (kind.AsString()) out->user_client = *kind.AsString();
  for (const auto& [key, flag] : {std::pair<const char*, bool*>{"openable", &out->openable},
                                  std::pair<const char*, bool*>{"closeFails", &out->close_fails}}) {
    const cf::Value& v = d->Get(key);
    if (v.IsNull()) continue;
    if (!v.AsBool()) return Fail(error, index, std::string("\"") + key + "\" must be a boolean");
    *flag = *v.AsBool();
  }
  return true;
}

}  // namespace

Registry Registry::Load(const cf::Value& plist, std::string* error) {
  Registry registry;
  if (plist.IsNull()) return registry;
  const cf::Array* entries = plist.AsArray();
  if (!entries) {
    if (error) *error = "the registry must be an array of services";
    return registry;
  }
  std::set<uint64_t> ids;
  for (size_t i = 0; i < entries->size(); ++i) {
    Service service;
    if (!ReadService((*entries)[i], i, &service, error)) return Registry();
    if (!ids.insert(service.id).second) {
      Fail(error, i, "\"id\" " + std::to_string(service.id) + " is used twice");
      return Registry();
    }
    registry.services_.push_back(std::move(service));
  }
  return registry;
}

const Service* Registry::Find(uint64_t id) const {
  for (const Service& s : services_)
    if (s.id == id) return &s;
  return nullptr;
}

std::vector<uint64_t> Registry::Match(const cf::Value& matching) const {
  std::vector<uint64_t> out;
  const cf::Dictionary* m = matching.AsDictionary();
  if (!m) return out;
  const cf::Value& class_name = m->Get("IOProviderClass");
  const cf::Value& name = m->Get("IONameMatch");
  const cf::Dictionary* properties = m->Get("IOPropertyMatch").AsDictionary();
  if (!m->Get("IOPropertyMatch").IsNull() && !properties) return out;
  for (const Service& s : services_) {
    if (!class_name.IsNull() && class_name != cf::Value(s.class_name)) continue;
    if (!name.IsNull() && name != cf::Value(s.name)) continue;
    bool all = true;
    if (properties)
      for (const auto& [key, value] : *properties) {
        const cf::Value* have = s.properties.Find(key);
        if (!have || *have != value) {
          all = false;
          break;
        }
      }
    if (all) out.push_back(s.id);
  }
  return out;
}

cf::Value Registry::Property(uint64_t id, std::string_view key, bool recursive) const {
  const cf::Value wanted{std::string(key)};
  // A parent chain that loops ends after every service has been seen once.
  for (size_t hops = 0; hops <= services_.size(); ++hops) {
    const Service* s = Find(id);
    if (!s) return {};
    if (const cf::Value* v = s->properties.Find(wanted)) return *v;
    if (!recursive || !s->parent) return {};
    id = *s->parent;
  }
  return {};
}

std::vector<std::string> Registry::AttachDevices() {
  std::vector<std::string> left_out;
  std::vector<Service> kept;
  for (Service& s : services_) {
    const ServiceAttacher attach = s.user_client.empty() ? nullptr : AttacherOf(s.user_client);
    std::string why;
    if (attach && !attach(s, &why)) {
      left_out.push_back(s.name + ": " + why);
      continue;
    }
    kept.push_back(std::move(s));
  }
  services_ = std::move(kept);
  return left_out;
}

}  // namespace sim
