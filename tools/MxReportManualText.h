#pragma once
// mxreport's and mxreport-stores' help as help2man reads it (their hidden --help-man):
// the same text, with the "Exit status:" and "See also:" headings written "*Exit
// status*" and "*See also*", which help2man makes sections of their own.

#include <string>

namespace mx {

inline std::string manualText(std::string help)
{
    for (std::string heading : {"Exit status", "See also"})
        if (auto at = help.find("\n" + heading + ":\n"); at != std::string::npos)
            help.replace(at + 1, heading.size() + 1, "*" + heading + "*");
    return help;
}

} // namespace mx
