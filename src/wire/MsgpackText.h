#pragma once
// Text written straight from MessagePack bytes, without decoding them into Values
// first: what a stop writes of a whole period, its summary event and its summary file,
// runs on the server queue over tens of millions of values at most. Each text is the
// one the decoded Value would give; the walk ends at what would not decode (a key
// that is not a string, an extension other than a date, a nesting too deep, bytes cut
// short), which bytes encoded from a Value never hold.

#include <functional>
#include <string>
#include <string_view>

namespace mx {

// Where the description of a key's value goes: the text to append it to.
using DescriptionTarget = std::function<std::string&(std::string_view key)>;

// Appends the text Value::description gives for each entry's value of an encoded
// dictionary to the text `into(key)` returns, in order.
void describeMsgpackEntries(std::string_view encoded, const DescriptionTarget& into);

// Appends the value as toJson(value).dump(4) writes it when it stands `level` levels
// deep in a document (its first line's indentation is the caller's). False when the
// bytes would not decode.
bool appendMsgpackPrettyJson(std::string& out, std::string_view encoded, std::size_t level);

} // namespace mx
