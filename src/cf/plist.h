// Property-list and JSON reading and writing.
//
// Reading accepts XML and binary property lists and JSON; malformed or
// hostile input gives a result with an error text, never a crash. XML is
// written by our own writer so that the bytes are exact and stable (integers
// keep their sign, reals round-trip); binary is written for service messages.
#pragma once

#include <string>
#include <string_view>

#include "cf/value.h"

namespace cf {

struct ParseResult {
  Value value;
  std::string error;  // empty on success
  bool ok() const { return error.empty(); }
};

// Nesting deeper than this is refused, so hostile input cannot exhaust the stack.
inline constexpr int kMaxNesting = 256;

// Detects the format from the bytes ("bplist00" starts a binary list).
ParseResult ParsePropertyList(std::string_view bytes);

// Whether a property list can carry the text: it must be valid UTF-8 and hold
// none of the characters XML 1.0 forbids (U+0000-U+0008, U+000B, U+000C,
// U+000E-U+001F, U+FFFE, U+FFFF). Everything that lets outside text into a
// value bound for the aggregated log or a preference file asks this one
// question. *why (when given) gets the first fault and its byte offset.
bool IsPropertyListString(std::string_view s, std::string* why = nullptr);

// An XML property list, version 1.0, tab-indented. Fails (with a reason in
// *error) for values a property list cannot hold: null, non-string keys,
// strings (keys or values) that IsPropertyListString refuses.
bool WriteXMLPropertyList(const Value& v, std::string& out, std::string* error);
bool WriteBinaryPropertyList(const Value& v, std::string& out, std::string* error);

ParseResult ParseJSON(std::string_view text);
// indent < 0 writes one line. Data is written as base64 text, dates as
// ISO-8601 text, and non-string keys as their description.
bool WriteJSON(const Value& v, std::string& out, std::string* error, int indent = -1);

std::string Base64Encode(const Data& d);
std::string ISO8601(const Date& d);  // "2026-11-22T10:00:00Z"

}  // namespace cf
