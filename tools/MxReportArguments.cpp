#include "tools/MxReportArguments.h"

#include <cctype>
#include <charconv>
#include <cstdio>
#include <limits>
#include <vector>

#include <fmt/format.h>

namespace mx {

namespace {

template <class Name>
std::int64_t parseNamed(const std::string& text, const char* what, std::int64_t maximum, Name name,
                        const std::vector<std::int64_t>& candidates)
{
    if (!text.empty() && (std::isdigit(static_cast<unsigned char>(text[0])) || text[0] == '-')) {
        auto value = parseInteger(text, what);
        if (value < 0 || value > maximum)
            throw UsageError{fmt::format("{} {} is out of range", what, text)};
        return value;
    }
    for (auto candidate : candidates)
        if (name(candidate) == text)
            return candidate;
    throw UsageError{fmt::format("unknown {} \"{}\"", what, text)};
}

} // namespace

std::int64_t parseInteger(const std::string& text, const char* what)
{
    try {
        std::size_t used = 0;
        long long value = std::stoll(text, &used, 0);
        if (used == text.size())
            return value;
    } catch (const std::exception&) {
    }
    throw UsageError{fmt::format("{} must be a number, not \"{}\"", what, text)};
}

std::int64_t parseDecimal(const std::string& text, const char* what)
{
    std::int64_t value = 0;
    auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), value, 10);
    if (text.empty() || failure != std::errc() || end != text.data() + text.size())
        throw UsageError{fmt::format("{} must be a decimal number, not \"{}\"", what, text)};
    return value;
}

ServiceType parseServiceType(const std::string& text)
{
    std::vector<std::int64_t> codes;
    for (int code = 0; code <= 12; ++code)
        codes.push_back(code);
    codes.push_back(65535);
    return static_cast<ServiceType>(parseNamed(
        text, "service type", 0xFFFF, [](std::int64_t code) { return MxReportingServiceTypeName(ServiceType(code)); },
        codes));
}

MessageCategory parseCategory(const std::string& text)
{
    std::vector<std::int64_t> codes;
    for (std::int64_t subsystem : {0x0ll, 0x80000000ll, 0x08000000ll, 0x10000000ll, 0x20000000ll, 0x40000000ll})
        for (std::int64_t low = 0; low <= 11; ++low)
            codes.push_back(subsystem | low);
    return static_cast<MessageCategory>(parseNamed(
        text, "category", 0xFFFFFFFF, [](std::int64_t code) { return MxReportingCategoryName(MessageCategory(code)); },
        codes));
}

MessageType parseMessageType(const std::string& text)
{
    return static_cast<MessageType>(parseNamed(
        text, "message type", 0xFFFF, [](std::int64_t code) { return MxReportingMessageTypeName(MessageType(code)); },
        {0, 1, 2, 3, 4, 5, 65535}));
}

nlohmann::ordered_json parseObject(const std::string& text)
{
    auto json = nlohmann::ordered_json::parse(text, nullptr, /*allow_exceptions=*/false);
    if (json.is_discarded() || !json.is_object())
        throw UsageError{fmt::format("expected a JSON object, not {}", text)};
    return json;
}

const std::string& argument(const Words& words, std::size_t index)
{
    if (index >= words.size())
        throw UsageError{fmt::format("{} needs more arguments (see mxreport help)", words.at(0))};
    return words[index];
}

mxr::Payload payloadOf(const nlohmann::ordered_json& object)
{
    mxr::Payload payload;
    for (const auto& [key, value] : object.items()) {
        const char* name = key.c_str();
        if (value.is_boolean())
            payload.add(name, value.get<bool>());
        else if (value.is_number_integer() && !value.is_number_unsigned())
            payload.add(name, value.get<std::int64_t>());
        else if (value.is_number_unsigned() &&
                 value.get<std::uint64_t>() <= std::uint64_t(std::numeric_limits<std::int64_t>::max()))
            payload.add(name, static_cast<std::int64_t>(value.get<std::uint64_t>()));
        else if (value.is_number_float())
            payload.add(name, value.get<double>());
        else if (value.is_string())
            payload.add(name, value.get<std::string>());
        else
            payload.addJson(name, value.dump().c_str());
    }
    return payload;
}

int failed(const std::string& command, int error)
{
    std::fprintf(stderr, "mxreport: %s: %s\n", command.c_str(), mxr::errorText(error).c_str());
    return kExitRefused;
}

} // namespace mx
