// `typhoractl font-names`: the PostScript and family names of font files, as the font registry
// reads them, to write user-fonts records for real files.
#pragma once

#include <string>
#include <vector>

namespace typhora::ctl {

int runFontNamesCommand(const std::vector<std::string>& args);

}  // namespace typhora::ctl
