// `typhoractl font`: the font registry from the command line, as a font provider's installation
// or a configuration profile changes it. Each change is written to the registry's files under the
// device root, then reported to the running daemon (fontChanged:reply:) so that checked-in
// clients hear of it.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

int runFontCommand(const ClientOptions& options, const std::string& root,
                   const std::vector<std::string>& args);

}  // namespace typhora::ctl
