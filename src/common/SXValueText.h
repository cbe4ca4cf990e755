// The text of a value, as log lines ("%@") and the summary event print it.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "sxreporting/types.h"

// Strings unchanged, integers in decimal, floating values in the shortest form that reads
// back exactly, booleans as 1 and 0, arrays and dictionaries as compact JSON (dictionary keys
// in ascending order), null as "(null)".
std::string SXValueText(const SXValue& value);

// A dictionary's member, given apart from the dictionary.
struct SXTextMember {
  std::string_view key;
  const SXValue* value;
};

class SXPackedValue;

// SXValueText of a packed dictionary, written straight from its bytes. `underscoreKeys`: every
// space in a key becomes "_" (of keys that became equal, the last in key order stays).
// `member`: added after that, in its place among the keys, or replacing the member of its key.
// A packed value that is not a dictionary counts as an empty one when either is asked for.
std::string SXPackedDictionaryText(const SXPackedValue& packed, bool underscoreKeys = false,
                                   std::optional<SXTextMember> member = std::nullopt);

// The two texts of a message's payload that the stores keep, written in one pass (the values'
// texts are written once): SXPackedDictionaryText(packed, true) and
// SXPackedDictionaryText(packed, false, member).
struct SXPayloadTexts {
  std::string underscored;
  std::string withMember;
};
SXPayloadTexts SXPackedDictionaryTexts(const SXPackedValue& packed, SXTextMember member);

// Shortest decimal text of a double that reads back to the same double.
std::string SXDoubleText(double value);
