// The parts of the page that a report is, as the build has read them.
#pragma once

#include <string_view>

namespace traces {

extern const std::string_view kReportHtml;  // has a place "@NAME@" for each of the other parts
extern const std::string_view kReportCss;
extern const std::string_view kReportJs;

}  // namespace traces
