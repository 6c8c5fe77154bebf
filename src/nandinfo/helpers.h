// Small shared routines of the storage statistics service: parser contexts
// to dictionaries, whitelisting with or without significant-digit rounding,
// safe lookups, typed number insertion, hexadecimal text, the marketing
// capacity. The last-error message lives with the parsers (parsers/context.h),
// which report through it too.
#pragma once

#include <cstddef>
#include <cstdint>

#include <string_view>

#include "cf/format.h"
#include "cf/value.h"
#include "parsers/context.h"

// name -> unsigned 64-bit number for every pair (a later pair with the same
// name replaces an earlier one); with allowed names (an array of strings, or
// a dictionary whose keys are they), only those.
cf::Dictionary CreateDictFromCxt(const GenericParserCxt& context, const cf::Value& allowed = cf::Value());
// Without a collection, the dictionary itself; else a new dictionary of the
// entries whose key the collection holds.
cf::Value CreateFilteredDict(const cf::Value& dictionary, const cf::Value& allowed);
// Without a digits dictionary, the dictionary itself; else the entries whose
// key the digits dictionary holds, numbers rounded with roundSig when round
// is set.
cf::Value CreateFilteredDict_SigDig(const cf::Value& dictionary, const cf::Value& digits, bool round);
cf::Value GetNumberFromDictionarySafe(const cf::Value& dictionary, const cf::Value& key);
cf::Value GetStringFromDictionarySafe(const cf::Value& dictionary, const cf::Value& key);
// A number of the platform type code from the bytes at value; nothing (and a
// log line) for an unknown type.
void setNumberValueForType(cf::Dictionary& dictionary, const cf::Value& key, const void* value, int type);
void appendNumberValueForType(cf::Array& array, const void* value, int type);
// A dictionary-apply callback: sets key to value in target.
void CopyDictionary(const cf::Value& key, const cf::Value& value, cf::Dictionary& target);
uint8_t hexStringToByte(const char* text, size_t length);
uint32_t hexStringToInt32(const char* text, size_t length);
int32_t GetUserCapacityInGB(uint32_t mebibytes);
uint64_t roundSig(uint64_t value, uint64_t digits);

// A progress line of the service: to the system log and to standard error
// (one trailing newline of the text is the line's end).
void SayNANDInfo(std::string_view line);
template <typename... A>
void SayNANDInfoF(std::string_view format, const A&... args) {
  SayNANDInfo(cf::Format(format, args...));
}
