// The day page: one self-contained HTML file (inline SVG, CSS and a few lines of script for
// the tap/hover readout), readable from phone width up.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_DAY_HTML_H_
#define LOGMGR_TOOLS_LOGMGRCTL_DAY_HTML_H_

#include <string>

#include "tools/logmgrctl/day_data.h"

namespace daypage {

// Text made safe for HTML element content and quoted attribute values.
std::string EscapeHtml(const std::string& text);

std::string RenderHtml(const DayData& day);

}  // namespace daypage

#endif  // LOGMGR_TOOLS_LOGMGRCTL_DAY_HTML_H_
