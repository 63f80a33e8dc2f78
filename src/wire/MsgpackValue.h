#pragma once
// Values on the wire: MessagePack objects to Values and back. Dates travel as the
// timestamp extension (type -1). Decoding untrusted input never throws and never
// recurses deeper than the limit; it says why a value was refused instead.

#include <optional>
#include <string>

#include <msgpack.hpp>

#include "value/Value.h"

namespace mx {

inline constexpr std::size_t kMsgpackMaximumDepth = 64;
inline constexpr std::int8_t kMsgpackTimestampExtension = -1;

// Nothing, with `reason` set, when the object holds what a Value cannot: a map key
// that is not a string, an extension other than the timestamp, or nesting deeper
// than `maximumDepth`.
std::optional<Value> decodeMsgpack(const msgpack::object& object, std::string& reason,
                                   std::size_t maximumDepth = kMsgpackMaximumDepth);

// The date a timestamp extension's body (without its type) holds; nothing when it is
// malformed or beyond what the clock holds.
std::optional<Date> decodeMsgpackTimestamp(const char* body, std::size_t size);

void encodeMsgpack(msgpack::packer<msgpack::sbuffer>& packer, const Value& value);
// The bytes encodeMsgpack writes for `value`, without writing them.
std::size_t encodedMsgpackBytes(const Value& value);

} // namespace mx
