// What the bytes of a unit mean, as text that compares equal for two units
// exactly when no reader could tell them apart: folding, line ends, blank
// lines, the case of names and parameter names, the order of parameters,
// vCard 2.1 bare parameters ("TEL;WORK:") against their TYPE= form,
// quoted-printable encoding and a CHARSET other than UTF-8 (decoded with
// iconv) make no difference. Values are otherwise compared as written.
#pragma once

#include <string>
#include <string_view>

#include "VantorSyncManager/Value.h"

namespace vtc::client {

struct LineMeaning {
  std::string name;        // upper case, group included
  std::string parameters;  // ";NAME=value" in a fixed order
  std::string value;       // decoded
};

// The meaning of one unfolded content line.
LineMeaning meaningOfLine(std::string_view text);

// The meaning of a unit's bytes: every non-blank line's meaning, one per
// line ("NAME;PARAMS:value"), joined with a line feed.
std::string meaningOf(std::string_view raw);

// The bytes a record field holds: its string, or its data when the bytes
// are not UTF-8; empty for any other value.
std::string_view rawOf(const Value& value);
// A field value for bytes: a string when they are UTF-8, else data, so that
// bytes in another character set travel unchanged.
Value fieldValue(std::string_view raw);

// Whether two field values mean the same (none equals only none).
bool sameMeaning(const Value& a, const Value& b);

}  // namespace vtc::client
