// The text of a value, as log lines ("%@") and the summary event print it.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "sxreporting/types.h"

// Strings unchanged, integers in decimal, floating values in the shortest form that reads
// back exactly, booleans as 1 and 0, arrays and dictionaries as compact JSON (dictionary keys
// in ascending order), null as "(null)".
std::string SXValueText(const SXValue& value);

// One member of a dictionary written by SXDictionaryText.
struct SXTextMember {
  std::string_view key;
  const SXValue* value;
};

// SXValueText of the dictionary holding `members`, which come in ascending key order without
// repeats: the text of a dictionary with changed keys, made without building it.
std::string SXDictionaryText(std::span<const SXTextMember> members);

// SXValueText of a copy of `dictionary` (an empty one when it is not a dictionary) whose
// member `key` is set to `value`, made without the copy.
std::string SXValueTextWithMember(const SXValue& dictionary, const std::string& key,
                                  const SXValue& value);

// The same, made from the SXValueText of a dictionary instead of the dictionary itself: the
// text is copied around the member, not written again. Nothing when the text cannot be read
// that way (a key with an escape in it, or not a dictionary's text); the caller then builds it
// from the dictionary.
std::optional<std::string> SXDictionaryTextWithMember(std::string_view dictionaryText,
                                                      const std::string& key, const SXValue& value);

// The members of a dictionary's SXValueText as slices of that text: each key (without its
// quotes) and the text of its value, in the text's order. Nothing when the text cannot be read
// that way (a key with an escape in it, or not a dictionary's text).
using SXTextSlices = std::vector<std::pair<std::string_view, std::string_view>>;
std::optional<SXTextSlices> SXDictionaryTextMembers(std::string_view dictionaryText);

// Shortest decimal text of a double that reads back to the same double.
std::string SXDoubleText(double value);
