// Property-list values as JSON, the one form every tool writes (docs/json-output.md): strings,
// numbers, booleans, arrays and objects as JSON has them; a date {"$date":
// "2026-12-07T23:49:17.25Z"} (UTC, with its fraction); data {"$data": "<base64>"}. A dictionary
// that could be taken for one of those (its only key starts with "$") is wrapped in
// {"$dictionary": {...}}, so that nothing changes type on the way.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

#include "plist/Value.h"

namespace tavrix::tools {

nlohmann::json toJson(const plist::Value& value);

// How JSON goes out: one line, or indented for people.
enum class JsonStyle { Short, Pretty };
// json as text in style, with a final line break.
std::string dumpJson(const nlohmann::json& json, JsonStyle style);

// A date as "YYYY-MM-DDTHH:MM:SS[.ffffff]Z".
std::string isoDate(const plist::Date& date);

}  // namespace tavrix::tools
