#pragma once
// What the two text forms of a value share: JSON string literals and the nesting of
// arrays and dictionaries. The description text and the JSON rows of the stores
// differ only in how they write the other values, which the caller supplies.

#include <string>
#include <string_view>

#include "value/Value.h"

namespace mx {

// `text` as a JSON string literal; invalid UTF-8 becomes U+FFFD, so it always parses.
void appendQuotedText(std::string& out, std::string_view text);

// `text` as one line a terminal shows as it is: control characters (C0, DEL, C1) are
// written as \n, \t, \r, \xNN or \uNNNN, and bytes that are not UTF-8 as \xNN. What
// a client names itself or sends reaches a log line or a status view only this way.
void appendPrintableText(std::string& out, std::string_view text);
// True when appendPrintableText would write `text` unchanged.
bool isPrintableText(std::string_view text);

// Arrays as [a,b] and dictionaries as {"k":v}, recursively; every other value goes
// to `scalar(out, value)`.
template <class Scalar>
void appendNested(std::string& out, const Value& value, const Scalar& scalar)
{
    if (const Array* array = value.asArray()) {
        out += '[';
        bool first = true;
        for (const auto& item : *array) {
            if (!first)
                out += ',';
            first = false;
            appendNested(out, item, scalar);
        }
        out += ']';
    } else if (const Dictionary* dictionary = value.asDictionary()) {
        out += '{';
        bool first = true;
        for (const auto& [key, item] : *dictionary) {
            if (!first)
                out += ',';
            first = false;
            appendQuotedText(out, key);
            out += ':';
            appendNested(out, item, scalar);
        }
        out += '}';
    } else {
        scalar(out, value);
    }
}

} // namespace mx
