#include "value/JsonValue.h"
#include "value/ValueText.h"

#include <cmath>
#include <iterator>

#include <fmt/format.h>

namespace mx {

std::string base64Encode(const Data& data)
{
    static constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string text;
    text.reserve((data.size() + 2) / 3 * 4);
    for (std::size_t i = 0; i < data.size(); i += 3) {
        std::uint32_t chunk = std::uint32_t(data[i]) << 16;
        if (i + 1 < data.size())
            chunk |= std::uint32_t(data[i + 1]) << 8;
        if (i + 2 < data.size())
            chunk |= data[i + 2];
        text += kAlphabet[(chunk >> 18) & 63];
        text += kAlphabet[(chunk >> 12) & 63];
        text += i + 1 < data.size() ? kAlphabet[(chunk >> 6) & 63] : '=';
        text += i + 2 < data.size() ? kAlphabet[chunk & 63] : '=';
    }
    return text;
}

nlohmann::ordered_json toJson(const Dictionary& dictionary)
{
    auto object = nlohmann::ordered_json::object();
    for (const auto& [key, value] : dictionary)
        object[key] = toJson(value);
    return object;
}

nlohmann::ordered_json toJson(const Value& value)
{
    switch (value.kind()) {
    case Value::Kind::Nil:
        return nullptr;
    case Value::Kind::Bool:
        return *value.asBool();
    case Value::Kind::Int:
        return *value.asInt();
    case Value::Kind::UInt:
        return *value.asUInt();
    case Value::Kind::Double: {
        double number = *value.asDouble();
        // JSON has no NaN or infinity; they are written as null rather than as invalid text.
        return std::isfinite(number) ? nlohmann::ordered_json(number) : nlohmann::ordered_json(nullptr);
    }
    case Value::Kind::String:
        return *value.asString();
    case Value::Kind::Date:
        return formatDate(*value.asDate());
    case Value::Kind::Data:
        return base64Encode(*value.asData());
    case Value::Kind::Array: {
        auto array = nlohmann::ordered_json::array();
        for (const auto& item : *value.asArray())
            array.push_back(toJson(item));
        return array;
    }
    case Value::Kind::Dictionary:
        return toJson(*value.asDictionary());
    }
    return nullptr;
}

namespace {

void appendJsonScalar(std::string& out, const Value& value)
{
    switch (value.kind()) {
    case Value::Kind::Nil:
        out += "null";
        break;
    case Value::Kind::Bool:
        out += *value.asBool() ? "true" : "false";
        break;
    case Value::Kind::Int: {
        fmt::format_int text(*value.asInt());
        out.append(text.data(), text.size());
        break;
    }
    case Value::Kind::UInt: {
        fmt::format_int text(*value.asUInt());
        out.append(text.data(), text.size());
        break;
    }
    case Value::Kind::Double: {
        double number = *value.asDouble();
        if (!std::isfinite(number)) {
            out += "null";
            break;
        }
        char text[32];
        std::string_view written(text, static_cast<std::size_t>(fmt::format_to(text, "{}", number) - text));
        out += written;
        // A whole number stays recognisably a float, as JSON writers print it.
        if (written.find_first_of(".eE") == std::string_view::npos)
            out += ".0";
        break;
    }
    case Value::Kind::String:
        appendQuotedText(out, *value.asString());
        break;
    case Value::Kind::Date:
        appendQuotedText(out, formatDate(*value.asDate()));
        break;
    case Value::Kind::Data:
        appendQuotedText(out, base64Encode(*value.asData()));
        break;
    default:
        break; // containers are walked by appendNested
    }
}

template <class Json>
Value fromAnyJson(const Json& json)
{
    switch (json.type()) {
    case nlohmann::json::value_t::null:
        return Value();
    case nlohmann::json::value_t::boolean:
        return json.template get<bool>();
    case nlohmann::json::value_t::number_integer:
        return json.template get<std::int64_t>();
    case nlohmann::json::value_t::number_unsigned: {
        auto number = json.template get<std::uint64_t>();
        // Small unsigned numbers read as plain integers, as a client would mean them.
        return number <= std::uint64_t(INT64_MAX) ? Value(std::int64_t(number)) : Value(number);
    }
    case nlohmann::json::value_t::number_float:
        return json.template get<double>();
    case nlohmann::json::value_t::string:
        return json.template get<std::string>();
    case nlohmann::json::value_t::array: {
        Array array;
        for (const auto& item : json)
            array.append(fromAnyJson(item));
        return array;
    }
    case nlohmann::json::value_t::object: {
        Dictionary dictionary;
        for (const auto& [key, item] : json.items())
            dictionary.set(key, fromAnyJson(item));
        return dictionary;
    }
    default:
        return Value();
    }
}

} // namespace

std::string toJsonText(const Value& value)
{
    std::string out;
    appendJsonText(out, value);
    return out;
}

void appendJsonText(std::string& out, const Value& value) { appendNested(out, value, appendJsonScalar); }

Value fromJson(const nlohmann::ordered_json& json) { return fromAnyJson(json); }
Value fromJson(const nlohmann::json& json) { return fromAnyJson(json); }

} // namespace mx
