#include "font_names_command.h"

#include <iostream>

#include "platform/linux/fonts/font_face_names.h"
#include "platform/value/json_codec.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl font-names FILE\n"
    "\n"
    "Prints the faces of a font file as a user-fonts record's \"familyName\": a JSON dictionary\n"
    "from each face's PostScript name to its family name, as read with FreeType.\n";

}  // namespace

int runFontNamesCommand(const std::vector<std::string>& args) {
  if (args.size() != 1 || args[0] == "--help" || args[0] == "-h") {
    std::cout << kUsage;
    return args.size() == 1 ? 0 : 2;
  }
  std::optional<Value> names = FontFaceNames::read(args[0]);
  if (!names) {
    std::cerr << "typhoractl: " << args[0] << " is not a font with named faces\n";
    return 1;
  }
  std::cout << JsonCodec::encode(*names) << "\n";
  return 0;
}

}  // namespace typhora::ctl
