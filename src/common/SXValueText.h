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

// Shortest decimal text of a double that reads back to the same double.
std::string SXDoubleText(double value);
