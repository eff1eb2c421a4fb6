#include "plist_command.h"

#include <cstdio>
#include <fstream>
#include <iostream>

#include "platform/value/cbor_codec.h"
#include "platform/value/json_codec.h"
#include "platform/value/plist_reader.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl plist show FILE\n"
    "       typhoractl plist convert --to json|cbor IN OUT\n"
    "\n"
    "show     prints a property-list file (CBOR or JSON) as indented JSON\n"
    "convert  rewrites IN as OUT in the given encoding ('-' for standard output)\n";

int fail(const std::string& message) {
  std::cerr << "typhoractl: " << message << "\n";
  return 1;
}

std::optional<Value> readOrReport(const std::string& path) {
  std::string error;
  auto value = PlistReader::readFile(path, {}, &error);
  if (!value) std::cerr << "typhoractl: " << path << ": " << error << "\n";
  return value;
}

bool writeAll(const std::string& path, const std::string& bytes) {
  if (path == "-") {
    std::cout << bytes;
    return static_cast<bool>(std::cout.flush());
  }
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  return static_cast<bool>(out.flush());
}

int show(const std::string& path) {
  auto value = readOrReport(path);
  if (!value) return 1;
  std::cout << JsonCodec::encode(*value, true) << "\n";
  return 0;
}

int convert(const std::string& to, const std::string& in, const std::string& out) {
  if (to != "json" && to != "cbor") return fail("--to takes json or cbor");
  auto value = readOrReport(in);
  if (!value) return 1;
  std::string bytes;
  if (to == "json") {
    bytes = JsonCodec::encode(*value, true) + "\n";
  } else {
    Bytes cbor = CborCodec::encode(*value);
    bytes.assign(cbor.begin(), cbor.end());
  }
  if (!writeAll(out, bytes)) return fail("cannot write " + out);
  return 0;
}

}  // namespace

int runPlistCommand(const std::vector<std::string>& args) {
  if (args.empty() || args[0] == "--help" || args[0] == "-h") {
    std::cout << kUsage;
    return args.empty() ? 2 : 0;
  }
  if (args[0] == "show" && args.size() == 2 && args[1] != "--help") return show(args[1]);
  if (args[0] == "convert" && args.size() == 5 && args[1] == "--to") {
    return convert(args[2], args[3], args[4]);
  }
  std::cerr << kUsage;
  return 2;
}

}  // namespace typhora::ctl
