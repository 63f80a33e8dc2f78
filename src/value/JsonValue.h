#pragma once
// Values as JSON and back: preferences files, CLI payloads, store payload columns
// and summary files. Dates become RFC 3339 UTC strings and raw data base64 text
// (JSON has neither, so the way back reads them as strings).

#include <nlohmann/json.hpp>

#include "value/Value.h"

namespace mx {

nlohmann::ordered_json toJson(const Value& value);
nlohmann::ordered_json toJson(const Dictionary& dictionary);
Value fromJson(const nlohmann::ordered_json& json);
Value fromJson(const nlohmann::json& json);

std::string base64Encode(const Data& data);

// The compact JSON text of a value, as toJson(value).dump() would write it but
// without building the tree first: the stores write one of these per row. Invalid
// UTF-8 in strings becomes U+FFFD so the text always parses.
std::string toJsonText(const Value& value);
// The same, appended to `out`: a writer reuses one buffer for every row.
void appendJsonText(std::string& out, const Value& value);

} // namespace mx
