#pragma once
// How mxreport reads its arguments: numbers (decimal or 0x), the vocabulary's names
// for service types, categories and message types, and JSON objects as payloads. Each
// throws UsageError with what was wrong.

#include <cstdint>
#include <string>

#include <nlohmann/json.hpp>

#include <mxreporting/mxreporting.hpp>

#include "Statistics/MxReportingVocabulary.h"
#include "tools/MxReportCommand.h"

namespace mx {

std::int64_t parseInteger(const std::string& text, const char* what);
// Decimal only, where a leading zero must not make a number octal.
std::int64_t parseDecimal(const std::string& text, const char* what);
ServiceType parseServiceType(const std::string& text);
MessageCategory parseCategory(const std::string& text);
MessageType parseMessageType(const std::string& text);
nlohmann::ordered_json parseObject(const std::string& text);
// The words[index] of a command, or a UsageError that it needs more.
const std::string& argument(const Words& words, std::size_t index);

// A JSON object as a payload, each key with its value's own kind.
mxr::Payload payloadOf(const nlohmann::ordered_json& object);

// Prints "COMMAND: what went wrong" and returns the exit status of a failed command.
int failed(const std::string& command, int error);

} // namespace mx
