#include "value/Value.h"
#include "value/ValueText.h"

#include <cassert>
#include <cmath>
#include <ctime>
#include <limits>
#include <unordered_map>

#include <fmt/format.h>

namespace mx {

// ---- Array

Array::Array(std::initializer_list<Value> values) : Array(std::vector<Value>(values)) {}

Array::Array(std::vector<Value> values)
{
    if (!values.empty())
        items_ = std::make_shared<const std::vector<Value>>(std::move(values));
}

std::size_t Array::size() const { return items_ ? items_->size() : 0; }

const Value& Array::operator[](std::size_t index) const
{
    assert(index < size());
    return (*items_)[index];
}

std::vector<Value>::const_iterator Array::begin() const
{
    static const std::vector<Value> none;
    return items_ ? items_->begin() : none.begin();
}

std::vector<Value>::const_iterator Array::end() const
{
    static const std::vector<Value> none;
    return items_ ? items_->end() : none.end();
}

std::vector<Value>& Array::mutableItems()
{
    if (!items_)
        items_ = std::make_shared<const std::vector<Value>>();
    else if (items_.use_count() > 1)
        items_ = std::make_shared<const std::vector<Value>>(*items_);
    // The storage is only ever shared as const; being its sole owner makes writing safe.
    return const_cast<std::vector<Value>&>(*items_);
}

void Array::append(Value value) { mutableItems().push_back(std::move(value)); }

bool operator==(const Array& a, const Array& b)
{
    if (a.items_ == b.items_)
        return true;
    if (a.size() != b.size())
        return false;
    for (std::size_t i = 0; i < a.size(); ++i)
        if (!(a[i] == b[i]))
            return false;
    return true;
}

// ---- Dictionary

// Small dictionaries (the usual report has 5-10 keys) are searched linearly; past
// that size an index keeps lookups constant-time so a hostile 100 000-key payload
// costs linear, not quadratic, time to build.
struct Dictionary::Storage {
    static constexpr std::size_t kIndexThreshold = 16;

    std::vector<Entry> entries;
    std::unordered_map<std::string, std::size_t> index;

    std::optional<std::size_t> position(std::string_view key) const
    {
        if (entries.size() <= kIndexThreshold) {
            for (std::size_t i = 0; i < entries.size(); ++i)
                if (entries[i].first == key)
                    return i;
            return std::nullopt;
        }
        auto found = index.find(std::string(key));
        if (found == index.end())
            return std::nullopt;
        return found->second;
    }

    void rebuildIndex()
    {
        index.clear();
        if (entries.size() <= kIndexThreshold)
            return;
        index.reserve(entries.size());
        for (std::size_t i = 0; i < entries.size(); ++i)
            index.emplace(entries[i].first, i);
    }
};

Dictionary::Dictionary(std::initializer_list<Entry> entries)
{
    for (const auto& entry : entries)
        set(entry.first, entry.second);
}

std::size_t Dictionary::size() const { return storage_ ? storage_->entries.size() : 0; }

const Value* Dictionary::find(std::string_view key) const
{
    if (!storage_)
        return nullptr;
    auto position = storage_->position(key);
    return position ? &storage_->entries[*position].second : nullptr;
}

std::vector<Dictionary::Entry>::const_iterator Dictionary::begin() const
{
    static const std::vector<Entry> none;
    return storage_ ? storage_->entries.begin() : none.begin();
}

std::vector<Dictionary::Entry>::const_iterator Dictionary::end() const
{
    static const std::vector<Entry> none;
    return storage_ ? storage_->entries.end() : none.end();
}

Dictionary::Storage& Dictionary::mutableStorage()
{
    if (!storage_)
        storage_ = std::make_shared<const Storage>();
    else if (storage_.use_count() > 1) {
        // A shared dictionary is most often copied to take one more entry: room for
        // it spares moving every entry again at once.
        auto copy = std::make_shared<Storage>();
        copy->entries.reserve(storage_->entries.size() + 1);
        copy->entries.insert(copy->entries.end(), storage_->entries.begin(), storage_->entries.end());
        copy->index = storage_->index;
        storage_ = std::move(copy);
    }
    // The storage is only ever shared as const; being its sole owner makes writing safe.
    return const_cast<Storage&>(*storage_);
}

void Dictionary::set(std::string key, Value value)
{
    auto& storage = mutableStorage();
    if (auto position = storage.position(key)) {
        storage.entries[*position].second = std::move(value);
        return;
    }
    storage.entries.emplace_back(std::move(key), std::move(value));
    if (storage.entries.size() == Storage::kIndexThreshold + 1)
        storage.rebuildIndex();
    else if (storage.entries.size() > Storage::kIndexThreshold)
        storage.index.emplace(storage.entries.back().first, storage.entries.size() - 1);
}

void Dictionary::reserve(std::size_t entries)
{
    if (entries > size())
        mutableStorage().entries.reserve(entries);
}

void Dictionary::erase(std::string_view key)
{
    if (!find(key))
        return;
    auto& storage = mutableStorage();
    auto position = *storage.position(key);
    storage.entries.erase(storage.entries.begin() + static_cast<std::ptrdiff_t>(position));
    storage.rebuildIndex();
}

void Dictionary::merge(const Dictionary& other)
{
    if (empty()) {
        storage_ = other.storage_;
        return;
    }
    for (const auto& [key, value] : other)
        set(key, value);
}

bool operator==(const Dictionary& a, const Dictionary& b)
{
    if (a.storage_ == b.storage_)
        return true;
    if (a.size() != b.size())
        return false;
    auto left = a.begin();
    for (auto right = b.begin(); right != b.end(); ++left, ++right)
        if (left->first != right->first || !(left->second == right->second))
            return false;
    return true;
}

// ---- Value

bool Value::isNumber() const
{
    switch (kind()) {
    case Kind::Bool:
    case Kind::Int:
    case Kind::UInt:
    case Kind::Double:
        return true;
    default:
        return false;
    }
}

std::int64_t Value::int64Value() const
{
    switch (kind()) {
    case Kind::Bool:
        return *asBool() ? 1 : 0;
    case Kind::Int:
        return *asInt();
    case Kind::UInt:
        return static_cast<std::int64_t>(*asUInt());
    case Kind::Double: {
        double value = *asDouble();
        if (std::isnan(value))
            return 0;
        if (value >= 9223372036854775807.0)
            return std::numeric_limits<std::int64_t>::max();
        if (value <= -9223372036854775808.0)
            return std::numeric_limits<std::int64_t>::min();
        return static_cast<std::int64_t>(value);
    }
    default:
        return 0;
    }
}

double Value::doubleValue() const
{
    switch (kind()) {
    case Kind::Bool:
        return *asBool() ? 1.0 : 0.0;
    case Kind::Int:
        return static_cast<double>(*asInt());
    case Kind::UInt:
        return static_cast<double>(*asUInt());
    case Kind::Double:
        return *asDouble();
    default:
        return 0.0;
    }
}

std::string formatDate(Date date)
{
    auto sinceEpoch = date.time_since_epoch();
    auto seconds = std::chrono::floor<std::chrono::seconds>(sinceEpoch);
    auto nanoseconds = (sinceEpoch - seconds).count();
    std::time_t time = static_cast<std::time_t>(seconds.count());
    std::tm utc{};
    gmtime_r(&time, &utc);
    std::string text = fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}", utc.tm_year + 1900, utc.tm_mon + 1,
                                   utc.tm_mday, utc.tm_hour, utc.tm_min, utc.tm_sec);
    if (nanoseconds != 0) {
        std::string fraction = fmt::format("{:09}", nanoseconds);
        fraction.erase(fraction.find_last_not_of('0') + 1);
        text += "." + fraction;
    }
    return text + "Z";
}

namespace {

// Length of the valid UTF-8 sequence at `text`, or 0 when it is not one.
std::size_t utf8Sequence(const unsigned char* text, std::size_t left)
{
    unsigned char lead = text[0];
    std::size_t length = lead < 0x80 ? 1
        : (lead >> 5) == 0x6         ? 2
        : (lead >> 4) == 0xE         ? 3
        : (lead >> 3) == 0x1E        ? 4
                                     : 0;
    if (length == 0 || length > left)
        return 0;
    for (std::size_t i = 1; i < length; ++i)
        if ((text[i] & 0xC0) != 0x80)
            return 0;
    std::uint32_t point = length == 1 ? lead : lead & (0x7F >> length);
    for (std::size_t i = 1; i < length; ++i)
        point = (point << 6) | (text[i] & 0x3F);
    static constexpr std::uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    if (point < kSmallest[length] || point > 0x10FFFF || (point >= 0xD800 && point <= 0xDFFF))
        return 0;
    return length;
}

bool plainAscii(unsigned char c) { return c >= 0x20 && c < 0x80 && c != '"' && c != '\\'; }

} // namespace

namespace {

// The length of the character at the start of `text` that appendPrintableText keeps
// as it is, or 0 when it must be escaped.
std::size_t printableCharacter(const unsigned char* text, std::size_t left)
{
    if (text[0] < 0x80)
        return text[0] >= 0x20 && text[0] != 0x7F ? 1 : 0;
    std::size_t length = utf8Sequence(text, left);
    // U+0080..U+009F, the C1 controls, are two bytes C2 80..C2 9F.
    if (length == 2 && text[0] == 0xC2 && text[1] < 0xA0)
        return 0;
    return length;
}

} // namespace

bool isPrintableText(std::string_view text)
{
    auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
    for (std::size_t i = 0; i < text.size();) {
        std::size_t length = printableCharacter(bytes + i, text.size() - i);
        if (length == 0)
            return false;
        i += length;
    }
    return true;
}

void appendPrintableText(std::string& out, std::string_view text)
{
    auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
    for (std::size_t i = 0; i < text.size();) {
        if (std::size_t length = printableCharacter(bytes + i, text.size() - i)) {
            out.append(text, i, length);
            i += length;
            continue;
        }
        unsigned char c = bytes[i];
        if (c == '\n') {
            out += "\\n";
        } else if (c == '\t') {
            out += "\\t";
        } else if (c == '\r') {
            out += "\\r";
        } else if (c == 0xC2 && utf8Sequence(bytes + i, text.size() - i) == 2) {
            out += fmt::format("\\u{:04x}", bytes[i + 1]);
            i += 2;
            continue;
        } else {
            out += fmt::format("\\x{:02x}", c);
        }
        ++i;
    }
}

void appendQuotedText(std::string& out, std::string_view text)
{
    out += '"';
    auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
    for (std::size_t i = 0; i < text.size();) {
        // Most text needs no escaping: copy each run of it at once.
        std::size_t run = i;
        while (run < text.size() && plainAscii(bytes[run]))
            ++run;
        out.append(text, i, run - i);
        i = run;
        if (i == text.size())
            break;
        unsigned char c = bytes[i];
        if (c >= 0x80) {
            std::size_t length = utf8Sequence(bytes + i, text.size() - i);
            if (length == 0) {
                out += "\ufffd";
                ++i;
            } else {
                out.append(text, i, length);
                i += length;
            }
            continue;
        }
        switch (c) {
        case '"':
            out += "\\\"";
            break;
        case '\\':
            out += "\\\\";
            break;
        case '\b':
            out += "\\b";
            break;
        case '\f':
            out += "\\f";
            break;
        case '\n':
            out += "\\n";
            break;
        case '\r':
            out += "\\r";
            break;
        case '\t':
            out += "\\t";
            break;
        default:
            out += fmt::format("\\u{:04x}", c);
        }
        ++i;
    }
    out += '"';
}

namespace {

// The values inside containers: strings quoted, the rest as at the top level.
void appendDescribedScalar(std::string& out, const Value& value)
{
    switch (value.kind()) {
    case Value::Kind::Nil:
        out += "null";
        break;
    case Value::Kind::Bool:
        out += *value.asBool() ? "true" : "false";
        break;
    case Value::Kind::Int:
        out += fmt::format("{}", *value.asInt());
        break;
    case Value::Kind::UInt:
        out += fmt::format("{}", *value.asUInt());
        break;
    case Value::Kind::Double:
        out += fmt::format("{}", *value.asDouble());
        break;
    case Value::Kind::String:
        appendQuotedText(out, *value.asString());
        break;
    case Value::Kind::Date:
        out += formatDate(*value.asDate());
        break;
    case Value::Kind::Data:
        out += '<';
        for (auto byte : *value.asData())
            out += fmt::format("{:02x}", byte);
        out += '>';
        break;
    default:
        break; // containers are walked by appendNested
    }
}

} // namespace

std::string Value::description() const
{
    if (const std::string* text = asString())
        return *text;
    std::string out;
    appendNested(out, *this, appendDescribedScalar);
    return out;
}

namespace {

// What std::string holds inside itself before it allocates.
constexpr std::size_t kInlineText = 15;

std::size_t heapText(const std::string& text) { return text.size() > kInlineText ? text.size() + 1 : 0; }

} // namespace

std::size_t approximateBytes(const Value& value)
{
    std::size_t bytes = sizeof(Value);
    if (const std::string* text = value.asString())
        bytes += heapText(*text);
    else if (const Data* data = value.asData())
        bytes += data->size();
    else if (const Array* array = value.asArray())
        for (const auto& item : *array)
            bytes += approximateBytes(item);
    else if (const Dictionary* dictionary = value.asDictionary())
        for (const auto& [key, item] : *dictionary)
            bytes += sizeof(std::string) + heapText(key) + approximateBytes(item);
    return bytes;
}

} // namespace mx
