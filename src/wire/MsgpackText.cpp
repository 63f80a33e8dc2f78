#include "wire/MsgpackText.h"

#include <bit>
#include <charconv>
#include <cstdint>
#include <cstring>

#include <fmt/format.h>

#include "value/JsonValue.h"
#include "value/ValueText.h"
#include "wire/MsgpackValue.h"

namespace mx {

namespace {

// Text appended to a string through a buffer of its own: most of what is written is
// a digit or two and a separator, each of which would otherwise be a call of its own.
class Text {
public:
    explicit Text(std::string& out) : target_(out) {}
    ~Text() { flushed(); }
    Text(const Text&) = delete;
    Text& operator=(const Text&) = delete;

    void operator+=(char c)
    {
        if (used_ == sizeof staged_)
            flushed();
        staged_[used_++] = c;
    }
    void operator+=(std::string_view text)
    {
        if (text.size() > sizeof staged_ - used_) {
            flushed() += text;
            return;
        }
        std::memcpy(staged_ + used_, text.data(), text.size());
        used_ += text.size();
    }
    void appendSpaces(std::size_t count)
    {
        if (count > sizeof staged_ - used_) {
            flushed().append(count, ' ');
            return;
        }
        std::memset(staged_ + used_, ' ', count);
        used_ += count;
    }
    template <class Integer>
    void appendInteger(Integer value)
    {
        constexpr std::size_t kDigits = 24;
        if (sizeof staged_ - used_ < kDigits)
            flushed();
        used_ =
            static_cast<std::size_t>(std::to_chars(staged_ + used_, staged_ + used_ + kDigits, value).ptr - staged_);
    }
    // 0 to 127, the numbers a single byte holds.
    void appendSmall(std::uint8_t value)
    {
        if (sizeof staged_ - used_ < 3)
            flushed();
        if (value >= 100) {
            staged_[used_++] = '1';
            value -= 100;
            staged_[used_++] = static_cast<char>('0' + value / 10);
        } else if (value >= 10) {
            staged_[used_++] = static_cast<char>('0' + value / 10);
        }
        staged_[used_++] = static_cast<char>('0' + value % 10);
    }
    void appendQuoted(std::string_view text) { appendQuotedText(flushed(), text); }
    // The string itself, with everything staged written to it.
    std::string& flushed()
    {
        target_.append(staged_, used_);
        used_ = 0;
        return target_;
    }

private:
    std::string& target_;
    char staged_[4096];
    std::size_t used_ = 0;
};

// Value::description inside a container: strings quoted, dates as they are, raw data
// in hexadecimal, arrays as [a,b], maps as {"k":v}.
struct Described {
    static void beginArray(Text& out, std::uint32_t, std::size_t) { out += '['; }
    static void beginMap(Text& out, std::uint32_t, std::size_t) { out += '{'; }
    static void separate(Text& out, std::size_t) { out += ','; }
    static void endArray(Text& out, std::uint32_t, std::size_t) { out += ']'; }
    static void endMap(Text& out, std::uint32_t, std::size_t) { out += '}'; }
    static void key(Text& out, std::string_view key)
    {
        out.appendQuoted(key);
        out += ':';
    }
    static void number(Text& out, double value) { fmt::format_to(std::back_inserter(out.flushed()), "{}", value); }
    static void date(Text& out, Date date) { out += formatDate(date); }
    static void data(Text& out, std::string_view bytes)
    {
        static constexpr char kDigits[] = "0123456789abcdef";
        out += '<';
        for (char c : bytes) {
            auto byte = static_cast<std::uint8_t>(c);
            out += kDigits[byte >> 4];
            out += kDigits[byte & 0x0f];
        }
        out += '>';
    }
};

// toJson(value).dump(4): four spaces a level, an item or entry a line, empty
// containers as [] and {}; dates and raw data as strings, and numbers JSON cannot
// hold as null.
struct PrettyJson {
    static constexpr std::size_t kIndent = 4;

    static void begin(Text& out, char bracket, std::uint32_t count, std::size_t level)
    {
        out += bracket;
        if (count != 0)
            newLine(out, level + 1);
    }
    static void end(Text& out, char bracket, std::uint32_t count, std::size_t level)
    {
        if (count != 0)
            newLine(out, level);
        out += bracket;
    }
    static void newLine(Text& out, std::size_t level)
    {
        out += '\n';
        out.appendSpaces(level * kIndent);
    }

    static void beginArray(Text& out, std::uint32_t count, std::size_t level) { begin(out, '[', count, level); }
    static void beginMap(Text& out, std::uint32_t count, std::size_t level) { begin(out, '{', count, level); }
    static void separate(Text& out, std::size_t level)
    {
        out += ',';
        newLine(out, level + 1);
    }
    static void endArray(Text& out, std::uint32_t count, std::size_t level) { end(out, ']', count, level); }
    static void endMap(Text& out, std::uint32_t count, std::size_t level) { end(out, '}', count, level); }
    static void key(Text& out, std::string_view key)
    {
        out.appendQuoted(key);
        out += ": ";
    }
    static void number(Text& out, double value)
    {
        std::string& text = out.flushed();
        appendJsonText(text, Value(value));
    }
    static void date(Text& out, Date date) { out.appendQuoted(formatDate(date)); }
    static void data(Text& out, std::string_view bytes)
    {
        out.appendQuoted(base64Encode(Data(bytes.begin(), bytes.end())));
    }
};

// Reads the bytes once and has the Style write each value. Kept to the format itself
// rather than a general parser's callbacks: an array of a million small numbers costs
// a few milliseconds, not the better part of a second.
template <class Style>
class Walker {
public:
    Walker(std::string_view bytes, Text& out) : next_(bytes.data()), end_(bytes.data() + bytes.size()), out_(&out) {}

    // Where what is walked next is written.
    void writeTo(Text& out) { out_ = &out; }

    bool readMapHeader(std::uint32_t& count)
    {
        if (next_ == end_)
            return false;
        auto lead = static_cast<std::uint8_t>(*next_);
        if ((lead & 0xf0) == 0x80) {
            ++next_;
            count = lead & 0x0f;
            return true;
        }
        if (lead != 0xde && lead != 0xdf)
            return false;
        ++next_;
        return lead == 0xde ? readLength<std::uint16_t>(count) : readLength<std::uint32_t>(count);
    }

    // Only consumes the bytes when they are a string.
    bool readString(std::string_view& text)
    {
        if (next_ == end_)
            return false;
        const char* start = next_;
        auto lead = static_cast<std::uint8_t>(*next_++);
        std::uint32_t length = 0;
        bool read = (lead & 0xe0) == 0xa0 ? (length = lead & 0x1f, true)
            : lead == 0xd9                ? readLength<std::uint8_t>(length)
            : lead == 0xda                ? readLength<std::uint16_t>(length)
            : lead == 0xdb                ? readLength<std::uint32_t>(length)
                                          : false;
        const char* bytes = nullptr;
        if (!read || !take(length, bytes)) {
            next_ = start;
            return false;
        }
        text = std::string_view(bytes, length);
        return true;
    }

    // `level` places the value in its document; `depth` counts its nesting.
    bool value(std::size_t level, std::size_t depth)
    {
        if (depth > kMaximumDepth || next_ == end_)
            return false;
        auto lead = static_cast<std::uint8_t>(*next_);
        if (lead <= 0x7f) {
            ++next_;
            out_->appendSmall(lead);
            return true;
        }
        if (lead >= 0xe0) {
            ++next_;
            out_->appendInteger(static_cast<std::int8_t>(lead));
            return true;
        }
        std::string_view text;
        if (readString(text)) {
            out_->appendQuoted(text);
            return true;
        }
        ++next_;
        std::uint32_t length = 0;
        if ((lead & 0xf0) == 0x90)
            return items(lead & 0x0f, level, depth);
        if ((lead & 0xf0) == 0x80)
            return entries(lead & 0x0f, level, depth);
        switch (lead) {
        case 0xc0:
            *out_ += "null";
            return true;
        case 0xc2:
            *out_ += "false";
            return true;
        case 0xc3:
            *out_ += "true";
            return true;
        case 0xc4:
            return readLength<std::uint8_t>(length) && data(length);
        case 0xc5:
            return readLength<std::uint16_t>(length) && data(length);
        case 0xc6:
            return readLength<std::uint32_t>(length) && data(length);
        case 0xc7:
            return readLength<std::uint8_t>(length) && date(length);
        case 0xc8:
            return readLength<std::uint16_t>(length) && date(length);
        case 0xc9:
            return readLength<std::uint32_t>(length) && date(length);
        case 0xca: {
            std::uint32_t bits = 0;
            if (!readBigEndian(bits))
                return false;
            Style::number(*out_, double{std::bit_cast<float>(bits)});
            return true;
        }
        case 0xcb: {
            std::uint64_t bits = 0;
            if (!readBigEndian(bits))
                return false;
            Style::number(*out_, std::bit_cast<double>(bits));
            return true;
        }
        case 0xcc:
            return integer<std::uint8_t>();
        case 0xcd:
            return integer<std::uint16_t>();
        case 0xce:
            return integer<std::uint32_t>();
        case 0xcf:
            return integer<std::uint64_t>();
        case 0xd0:
            return integer<std::int8_t>();
        case 0xd1:
            return integer<std::int16_t>();
        case 0xd2:
            return integer<std::int32_t>();
        case 0xd3:
            return integer<std::int64_t>();
        case 0xd4:
        case 0xd5:
        case 0xd6:
        case 0xd7:
        case 0xd8:
            return date(1u << (lead - 0xd4));
        case 0xdc:
            return readLength<std::uint16_t>(length) && items(length, level, depth);
        case 0xdd:
            return readLength<std::uint32_t>(length) && items(length, level, depth);
        case 0xde:
            return readLength<std::uint16_t>(length) && entries(length, level, depth);
        case 0xdf:
            return readLength<std::uint32_t>(length) && entries(length, level, depth);
        default:
            return false;
        }
    }

private:
    // Stored values hold at most a level more than the wire: a report under its
    // identifier.
    static constexpr std::size_t kMaximumDepth = kMsgpackMaximumDepth + 1;

    bool take(std::size_t count, const char*& bytes)
    {
        if (static_cast<std::size_t>(end_ - next_) < count)
            return false;
        bytes = next_;
        next_ += count;
        return true;
    }

    template <class Number>
    bool readBigEndian(Number& number)
    {
        const char* bytes = nullptr;
        if (!take(sizeof(Number), bytes))
            return false;
        std::make_unsigned_t<Number> raw = 0;
        for (std::size_t i = 0; i < sizeof(Number); ++i)
            raw = static_cast<decltype(raw)>((raw << 8) | static_cast<std::uint8_t>(bytes[i]));
        number = static_cast<Number>(raw);
        return true;
    }

    template <class Length>
    bool readLength(std::uint32_t& length)
    {
        Length value = 0;
        if (!readBigEndian(value))
            return false;
        length = value;
        return true;
    }

    template <class Integer>
    bool integer()
    {
        Integer value = 0;
        if (!readBigEndian(value))
            return false;
        out_->appendInteger(value);
        return true;
    }

    bool data(std::uint32_t length)
    {
        const char* bytes = nullptr;
        if (!take(length, bytes))
            return false;
        Style::data(*out_, std::string_view(bytes, length));
        return true;
    }

    bool date(std::uint32_t length)
    {
        const char* type = nullptr;
        const char* body = nullptr;
        if (!take(1, type) || static_cast<std::int8_t>(*type) != kMsgpackTimestampExtension || !take(length, body))
            return false;
        auto date = decodeMsgpackTimestamp(body, length);
        if (!date)
            return false;
        Style::date(*out_, *date);
        return true;
    }

    bool items(std::uint32_t count, std::size_t level, std::size_t depth)
    {
        Style::beginArray(*out_, count, level);
        for (std::uint32_t i = 0; i < count; ++i) {
            if (i != 0)
                Style::separate(*out_, level);
            // Small numbers fill the largest arrays: they skip the general walk.
            if (next_ != end_ && static_cast<std::uint8_t>(*next_) <= 0x7f) {
                out_->appendSmall(static_cast<std::uint8_t>(*next_++));
                continue;
            }
            if (!value(level + 1, depth + 1))
                return false;
        }
        Style::endArray(*out_, count, level);
        return true;
    }

    bool entries(std::uint32_t count, std::size_t level, std::size_t depth)
    {
        Style::beginMap(*out_, count, level);
        for (std::uint32_t i = 0; i < count; ++i) {
            if (i != 0)
                Style::separate(*out_, level);
            std::string_view key;
            if (!readString(key))
                return false;
            Style::key(*out_, key);
            if (!value(level + 1, depth + 1))
                return false;
        }
        Style::endMap(*out_, count, level);
        return true;
    }

    const char* next_;
    const char* const end_;
    Text* out_;
};

} // namespace

void describeMsgpackEntries(std::string_view encoded, const DescriptionTarget& into)
{
    std::string unused;
    Text nowhere(unused);
    Walker<Described> walker(encoded, nowhere);
    std::uint32_t count = 0;
    if (!walker.readMapHeader(count))
        return;
    for (std::uint32_t i = 0; i < count; ++i) {
        std::string_view key;
        if (!walker.readString(key))
            return;
        Text text(into(key));
        // A string directly under its key is the text itself.
        std::string_view bare;
        if (walker.readString(bare)) {
            text += bare;
            continue;
        }
        walker.writeTo(text);
        bool described = walker.value(0, 2);
        walker.writeTo(nowhere);
        if (!described)
            return;
    }
}

bool appendMsgpackPrettyJson(std::string& out, std::string_view encoded, std::size_t level)
{
    Text text(out);
    return Walker<PrettyJson>(encoded, text).value(level, 1);
}

} // namespace mx
