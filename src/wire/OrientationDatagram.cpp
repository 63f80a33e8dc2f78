#include "wire/OrientationDatagram.h"

#include "wire/Datagram.h"
#include "wire/RootPath.h"

#include <array>
#include <charconv>

namespace mx {

namespace {

constexpr std::array<std::string_view, 7> kTexts = {
    "unknown", "portrait", "portrait-upside-down", "landscape-left", "landscape-right", "face-up", "face-down",
};

std::optional<int> parseInteger(std::string_view text)
{
    int value = 0;
    const char* end = text.data() + text.size();
    auto [stop, failure] = std::from_chars(text.data(), end, value);
    if (text.empty() || failure != std::errc() || stop != end)
        return std::nullopt;
    return value;
}

} // namespace

std::optional<OrientationChange> parseOrientationDatagram(std::string_view datagram)
{
    if (datagram.ends_with('\n'))
        datagram.remove_suffix(1);
    auto space = datagram.find(' ');
    if (space == std::string_view::npos)
        return std::nullopt;
    std::string_view word = datagram.substr(0, space);
    std::optional<OrientationKind> kind;
    if (word == "device")
        kind = OrientationKind::Device;
    else if (word == "ui")
        kind = OrientationKind::UI;
    auto value = parseInteger(datagram.substr(space + 1));
    if (!kind || !value)
        return std::nullopt;
    return OrientationChange{*kind, *value};
}

std::string formatOrientationDatagram(const OrientationChange& change)
{
    return (change.kind == OrientationKind::Device ? "device " : "ui ") + std::to_string(change.orientation);
}

std::uint32_t postOrientationChange(const OrientationChange& change)
{
    return sendDatagram(MxReportingPath(kOrientationFeedPath), formatOrientationDatagram(change));
}

std::string_view orientationText(int orientation)
{
    if (orientation < 0 || orientation >= static_cast<int>(kTexts.size()))
        return kTexts[0];
    return kTexts[static_cast<std::size_t>(orientation)];
}

std::optional<int> orientationFromText(std::string_view text)
{
    for (std::size_t value = 0; value < kTexts.size(); ++value)
        if (kTexts[value] == text)
            return static_cast<int>(value);
    return parseInteger(text);
}

} // namespace mx
