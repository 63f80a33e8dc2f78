#pragma once
// Values as JSON and back: preferences files, CLI payloads, store payload columns
// and summary files. Dates become RFC 3339 UTC strings and raw data base64 text
// (JSON has neither, so the way back reads them as strings).

#include <nlohmann/json.hpp>

#include "platform/Value.h"

namespace mx {

nlohmann::ordered_json toJson(const Value& value);
nlohmann::ordered_json toJson(const Dictionary& dictionary);
Value fromJson(const nlohmann::ordered_json& json);
Value fromJson(const nlohmann::json& json);

std::string base64Encode(const Data& data);

} // namespace mx
