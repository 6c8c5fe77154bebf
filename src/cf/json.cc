#include <nlohmann/json.hpp>

#include "cf/plist.h"

namespace cf {

namespace {

using Json = nlohmann::ordered_json;

bool FromJson(const Json& j, int depth, Value& out, std::string& error) {
  if (depth > kMaxNesting) {
    error = "JSON nested too deeply";
    return false;
  }
  switch (j.type()) {
    case Json::value_t::null: out = Value(); return true;
    case Json::value_t::boolean: out = Value::Bool(j.get<bool>()); return true;
    case Json::value_t::number_integer: out = Number::SInt64(j.get<int64_t>()); return true;
    case Json::value_t::number_unsigned: {
      const uint64_t u = j.get<uint64_t>();
      out = u > static_cast<uint64_t>(INT64_MAX) ? Number::UInt64(u) : Number::SInt64(static_cast<int64_t>(u));
      return true;
    }
    case Json::value_t::number_float: out = Number::Float64(j.get<double>()); return true;
    case Json::value_t::string: out = j.get<std::string>(); return true;
    case Json::value_t::array: {
      Array a;
      for (const auto& item : j) {
        Value v;
        if (!FromJson(item, depth + 1, v, error)) return false;
        a.Append(std::move(v));
      }
      out = a;
      return true;
    }
    case Json::value_t::object: {
      Dictionary d;
      for (const auto& [k, item] : j.items()) {
        Value v;
        if (!FromJson(item, depth + 1, v, error)) return false;
        d.Set(k, std::move(v));
      }
      out = d;
      return true;
    }
    default:
      error = "unsupported JSON value";
      return false;
  }
}

bool ToJson(const Value& v, int depth, Json& out, std::string& error) {
  if (depth > kMaxNesting) {
    error = "value nested too deeply";
    return false;
  }
  switch (v.type()) {
    case Type::kNull: out = nullptr; return true;
    case Type::kBoolean: out = *v.AsBool(); return true;
    case Type::kNumber: {
      const Number& n = *v.AsNumber();
      if (n.IsFloat()) out = n.AsFloat64();
      else if (n.IsUnsigned()) out = n.AsUInt64();
      else out = n.AsSInt64();
      return true;
    }
    case Type::kString: out = *v.AsString(); return true;
    case Type::kData: out = Base64Encode(*v.AsData()); return true;
    case Type::kDate: out = ISO8601(*v.AsDate()); return true;
    case Type::kArray: {
      out = Json::array();
      for (const Value& item : *v.AsArray()) {
        Json j;
        if (!ToJson(item, depth + 1, j, error)) return false;
        out.push_back(std::move(j));
      }
      return true;
    }
    case Type::kDictionary: {
      out = Json::object();
      for (const auto& [k, item] : *v.AsDictionary()) {
        Json j;
        if (!ToJson(item, depth + 1, j, error)) return false;
        out[k.AsString() ? *k.AsString() : k.Description()] = std::move(j);
      }
      return true;
    }
  }
  return false;
}

}  // namespace

ParseResult ParseJSON(std::string_view text) {
  ParseResult r;
  Json j;
  try {
    // The callback refuses deep nesting before the parser builds it.
    j = Json::parse(text.begin(), text.end(), [](int depth, Json::parse_event_t, Json&) {
      if (depth > kMaxNesting) throw std::runtime_error("JSON nested too deeply");
      return true;
    });
  } catch (const std::exception& e) {
    r.error = std::string("malformed JSON: ") + e.what();
    return r;
  }
  if (!FromJson(j, 0, r.value, r.error)) r.value = Value();
  return r;
}

bool WriteJSON(const Value& v, std::string& out, std::string* error, int indent) {
  Json j;
  std::string err;
  if (!ToJson(v, 0, j, err)) {
    if (error) *error = err;
    return false;
  }
  out = j.dump(indent, ' ', false, Json::error_handler_t::replace);
  return true;
}

}  // namespace cf
