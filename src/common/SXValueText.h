// The text of a value, as log lines ("%@") and the summary event print it.
#pragma once

#include <string>

#include "sxreporting/types.h"

// Strings unchanged, integers in decimal, floating values in the shortest form that reads
// back exactly, booleans as 1 and 0, arrays and dictionaries as compact JSON (dictionary keys
// in ascending order), null as "(null)".
std::string SXValueText(const SXValue& value);

// SXValueText of a copy of `dictionary` (an empty one when it is not a dictionary) whose
// member `key` is set to `value`, made without the copy.
std::string SXValueTextWithMember(const SXValue& dictionary, const std::string& key,
                                  const SXValue& value);

// Shortest decimal text of a double that reads back to the same double.
std::string SXDoubleText(double value);
