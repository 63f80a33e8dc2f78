#include "wire/MsgpackValue.h"

#include <fmt/format.h>

#include <cstring>

namespace mx {

namespace {

std::uint64_t readBigEndian(const char* bytes, std::size_t count)
{
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < count; ++i)
        value = (value << 8) | static_cast<std::uint8_t>(bytes[i]);
    return value;
}

} // namespace

std::optional<Date> decodeMsgpackTimestamp(const char* body, std::size_t size)
{
    std::int64_t seconds = 0;
    std::uint32_t nanoseconds = 0;
    switch (size) {
    case 4:
        seconds = static_cast<std::int64_t>(readBigEndian(body, 4));
        break;
    case 8: {
        std::uint64_t packed = readBigEndian(body, 8);
        nanoseconds = static_cast<std::uint32_t>(packed >> 34);
        seconds = static_cast<std::int64_t>(packed & 0x3FFFFFFFFull);
        break;
    }
    case 12:
        nanoseconds = static_cast<std::uint32_t>(readBigEndian(body, 4));
        seconds = static_cast<std::int64_t>(readBigEndian(body + 4, 8));
        break;
    default:
        return std::nullopt;
    }
    // Beyond a few hundred years either way the nanosecond clock overflows.
    constexpr std::int64_t kLimit = 9'000'000'000;
    if (nanoseconds > 999'999'999 || seconds > kLimit || seconds < -kLimit)
        return std::nullopt;
    return Date(std::chrono::seconds(seconds) + std::chrono::nanoseconds(nanoseconds));
}

namespace {

std::optional<Value> decode(const msgpack::object& object, std::size_t depth, std::size_t maximumDepth,
                            std::string& reason)
{
    if (depth > maximumDepth) {
        reason = fmt::format("nesting deeper than {}", maximumDepth);
        return std::nullopt;
    }
    switch (object.type) {
    case msgpack::type::NIL:
        return Value();
    case msgpack::type::BOOLEAN:
        return Value(object.via.boolean);
    case msgpack::type::POSITIVE_INTEGER:
        if (object.via.u64 <= std::uint64_t(INT64_MAX))
            return Value(static_cast<std::int64_t>(object.via.u64));
        return Value(object.via.u64);
    case msgpack::type::NEGATIVE_INTEGER:
        return Value(object.via.i64);
    case msgpack::type::FLOAT32:
    case msgpack::type::FLOAT64:
        return Value(object.via.f64);
    case msgpack::type::STR:
        return Value(std::string(object.via.str.ptr, object.via.str.size));
    case msgpack::type::BIN:
        return Value(Data(reinterpret_cast<const std::uint8_t*>(object.via.bin.ptr),
                          reinterpret_cast<const std::uint8_t*>(object.via.bin.ptr) + object.via.bin.size));
    case msgpack::type::EXT: {
        if (object.via.ext.type() != kMsgpackTimestampExtension) {
            reason = "extension type " + std::to_string(object.via.ext.type()) + " is not a date";
            return std::nullopt;
        }
        auto date = decodeMsgpackTimestamp(object.via.ext.data(), object.via.ext.size);
        if (!date) {
            reason = "malformed timestamp";
            return std::nullopt;
        }
        return Value(*date);
    }
    case msgpack::type::ARRAY: {
        std::vector<Value> items;
        items.reserve(object.via.array.size);
        for (std::uint32_t i = 0; i < object.via.array.size; ++i) {
            auto item = decode(object.via.array.ptr[i], depth + 1, maximumDepth, reason);
            if (!item)
                return std::nullopt;
            items.push_back(std::move(*item));
        }
        return Value(Array(std::move(items)));
    }
    case msgpack::type::MAP: {
        Dictionary dictionary;
        dictionary.reserve(object.via.map.size);
        for (std::uint32_t i = 0; i < object.via.map.size; ++i) {
            const auto& entry = object.via.map.ptr[i];
            if (entry.key.type != msgpack::type::STR) {
                reason = "map key is not a string";
                return std::nullopt;
            }
            auto item = decode(entry.val, depth + 1, maximumDepth, reason);
            if (!item)
                return std::nullopt;
            dictionary.set(std::string(entry.key.via.str.ptr, entry.key.via.str.size), std::move(*item));
        }
        return Value(std::move(dictionary));
    }
    }
    reason = "unknown object type";
    return std::nullopt;
}

void encodeDate(msgpack::packer<msgpack::sbuffer>& packer, Date date)
{
    auto sinceEpoch = date.time_since_epoch();
    auto seconds = std::chrono::floor<std::chrono::seconds>(sinceEpoch);
    auto nanoseconds = static_cast<std::uint32_t>((sinceEpoch - seconds).count());
    std::int64_t secondsCount = seconds.count();
    char bytes[12];
    auto put = [&](std::size_t offset, std::uint64_t value, std::size_t count) {
        for (std::size_t i = 0; i < count; ++i)
            bytes[offset + i] = static_cast<char>(value >> (8 * (count - 1 - i)));
    };
    if (secondsCount >= 0 && secondsCount < (std::int64_t(1) << 34)) {
        put(0, (std::uint64_t(nanoseconds) << 34) | std::uint64_t(secondsCount), 8);
        packer.pack_ext(8, kMsgpackTimestampExtension);
        packer.pack_ext_body(bytes, 8);
        return;
    }
    put(0, nanoseconds, 4);
    put(4, static_cast<std::uint64_t>(secondsCount), 8);
    packer.pack_ext(12, kMsgpackTimestampExtension);
    packer.pack_ext_body(bytes, 12);
}

} // namespace

std::optional<Value> decodeMsgpack(const msgpack::object& object, std::string& reason, std::size_t maximumDepth)
{
    return decode(object, 1, maximumDepth, reason);
}

void encodeMsgpack(msgpack::packer<msgpack::sbuffer>& packer, const Value& value)
{
    switch (value.kind()) {
    case Value::Kind::Nil:
        packer.pack_nil();
        break;
    case Value::Kind::Bool:
        *value.asBool() ? packer.pack_true() : packer.pack_false();
        break;
    case Value::Kind::Int:
        packer.pack_int64(*value.asInt());
        break;
    case Value::Kind::UInt:
        packer.pack_uint64(*value.asUInt());
        break;
    case Value::Kind::Double:
        packer.pack_double(*value.asDouble());
        break;
    case Value::Kind::String: {
        const auto& text = *value.asString();
        packer.pack_str(static_cast<std::uint32_t>(text.size()));
        packer.pack_str_body(text.data(), static_cast<std::uint32_t>(text.size()));
        break;
    }
    case Value::Kind::Date:
        encodeDate(packer, *value.asDate());
        break;
    case Value::Kind::Data: {
        const auto& data = *value.asData();
        packer.pack_bin(static_cast<std::uint32_t>(data.size()));
        packer.pack_bin_body(reinterpret_cast<const char*>(data.data()), static_cast<std::uint32_t>(data.size()));
        break;
    }
    case Value::Kind::Array:
        packer.pack_array(static_cast<std::uint32_t>(value.asArray()->size()));
        for (const auto& item : *value.asArray())
            encodeMsgpack(packer, item);
        break;
    case Value::Kind::Dictionary:
        packer.pack_map(static_cast<std::uint32_t>(value.asDictionary()->size()));
        for (const auto& [key, item] : *value.asDictionary()) {
            packer.pack_str(static_cast<std::uint32_t>(key.size()));
            packer.pack_str_body(key.data(), static_cast<std::uint32_t>(key.size()));
            encodeMsgpack(packer, item);
        }
        break;
    }
}

namespace {

// A string's, binary's or container's header: its length in the smallest form.
std::size_t lengthHeaderBytes(std::size_t length, std::size_t fixedBelow)
{
    if (length < fixedBelow)
        return 1;
    if (length <= 0xFF && fixedBelow != 16)
        return 2;
    return length <= 0xFFFF ? 3 : 5;
}

std::size_t unsignedBytes(std::uint64_t number)
{
    if (number < 0x80)
        return 1;
    if (number <= 0xFF)
        return 2;
    if (number <= 0xFFFF)
        return 3;
    return number <= 0xFFFFFFFF ? 5 : 9;
}

std::size_t signedBytes(std::int64_t number)
{
    if (number >= 0)
        return unsignedBytes(static_cast<std::uint64_t>(number));
    if (number >= -32)
        return 1;
    if (number >= -0x80)
        return 2;
    if (number >= -0x8000)
        return 3;
    return number >= -0x80000000LL ? 5 : 9;
}

} // namespace

std::size_t encodedMsgpackBytes(const Value& value)
{
    switch (value.kind()) {
    case Value::Kind::Nil:
    case Value::Kind::Bool:
        return 1;
    case Value::Kind::Int:
        return signedBytes(*value.asInt());
    case Value::Kind::UInt:
        return unsignedBytes(*value.asUInt());
    case Value::Kind::Double:
        return 9;
    case Value::Kind::String:
        return lengthHeaderBytes(value.asString()->size(), 32) + value.asString()->size();
    case Value::Kind::Date: {
        auto seconds = std::chrono::floor<std::chrono::seconds>(value.asDate()->time_since_epoch()).count();
        return seconds >= 0 && seconds < (std::int64_t(1) << 34) ? 10 : 15;
    }
    case Value::Kind::Data:
        return lengthHeaderBytes(value.asData()->size(), 0) + value.asData()->size();
    case Value::Kind::Array: {
        std::size_t bytes = lengthHeaderBytes(value.asArray()->size(), 16);
        for (const auto& item : *value.asArray())
            bytes += encodedMsgpackBytes(item);
        return bytes;
    }
    case Value::Kind::Dictionary: {
        std::size_t bytes = lengthHeaderBytes(value.asDictionary()->size(), 16);
        for (const auto& [key, item] : *value.asDictionary())
            bytes += lengthHeaderBytes(key.size(), 32) + key.size() + encodedMsgpackBytes(item);
        return bytes;
    }
    }
    return 0;
}

} // namespace mx
