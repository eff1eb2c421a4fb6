// The font-picker roles of typhoractl:
//   picker-client  an application that offers TyphoraFontPickerClientSupportProtocol on an
//                  endpoint and starts the picker with it; it prints the fonts it is given;
//   pick           the font picker: asks the daemon to deliver a PostScript font's family to the
//                  client whose endpoint it was started with (descriptor 3).
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

int runPickerClientCommand(const ClientOptions& options, const std::vector<std::string>& args);
int runPickCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
