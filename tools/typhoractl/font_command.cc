#include "font_command.h"

#include <cctype>
#include <iostream>
#include <set>

#include "ipc/interface_descriptions.h"
#include "platform/dispatch/semaphore.h"
#include "platform/linux/fonts/linux_user_font_manager.h"
#include "platform/value/json_codec.h"
#include "service_session.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl [--root DIR] font install --provider ID FILE...\n"
    "       typhoractl [--root DIR] font remove PATH... | --provider ID\n"
    "       typhoractl [--root DIR] font enable|disable PATH...\n"
    "       typhoractl [--root DIR] font list [--provider ID]\n"
    "\n"
    "install  copies font files into the provider's directory under the device root and records\n"
    "         their faces (PostScript and family names, read with FreeType; every face of a\n"
    "         collection and every named instance of a variable font), enabled. Files that are\n"
    "         not complete fonts are refused and nothing is installed.\n"
    "remove   forgets fonts and deletes their files; --provider: every font of the provider,\n"
    "         with its directory.\n"
    "enable, disable  marks fonts enabled or disabled.\n"
    "list     the registry's fonts as a JSON array.\n"
    "PATH is a font's path in the registry, as 'list' prints it\n"
    "(/var/mobile/Library/UserFonts/FontFiles/<provider>/<file>).\n"
    "\n"
    "After a change the daemon is told with fontChanged:reply:; each change prints one JSON\n"
    "object with the paths it touched and whether the daemon was told (\"notified\").\n";
constexpr const char* kFontFiles = "/var/mobile/Library/UserFonts/FontFiles/";

bool isUnreserved(unsigned char c) {
  return std::isalnum(c) != 0 || c == '/' || c == '-' || c == '.' || c == '_' || c == '~';
}

std::string fileUrl(const std::string& path) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string url = "file://";
  for (unsigned char c : path) {
    if (isUnreserved(c)) {
      url += static_cast<char>(c);
    } else {
      url += '%';
      url += kHex[c >> 4];
      url += kHex[c & 15];
    }
  }
  return url;
}

Value stringArray(const std::vector<std::string>& strings) {
  return Value(ValueArray(strings.begin(), strings.end()));
}

// Tells the daemon what changed; false (with a line on standard error) when it cannot be told,
// in which case it learns of the change when it next reads the registry.
bool notifyDaemon(const ClientOptions& options, bool added, const std::vector<std::string>& paths) {
  std::vector<std::string> urls;
  for (const std::string& path : paths) urls.push_back(fileUrl(path));
  const Value change =
      Value::dictionary({{"added", added}, {"kind", 0}, {"urls", stringArray(urls)}});
  CallResult result =
      ServiceSession(options, typhoraDaemonProtocol()).call(op::kFontChanged, {change});
  if (!result.ok)
    std::cerr << "typhoractl: the daemon was not told of the change: "
              << (result.error.empty() ? "no reply" : result.error) << "\n";
  return result.ok;
}

int printChange(const char* what, const std::vector<std::string>& paths, bool notified) {
  std::cout << JsonCodec::encode(
                   Value::dictionary({{what, stringArray(paths)}, {"notified", notified}}))
            << "\n";
  return 0;
}

int fail(const std::string& error) {
  std::cerr << "typhoractl: " << error << "\n";
  return 1;
}

std::string providerOf(const std::string& path) {
  if (!path.starts_with(kFontFiles)) return {};
  const std::string rest = path.substr(std::string(kFontFiles).size());
  const std::size_t slash = rest.find('/');
  return slash == std::string::npos ? std::string() : rest.substr(0, slash);
}

std::vector<std::string> pathsOfProvider(LinuxUserFontManager& registry,
                                         const std::string& provider) {
  std::vector<std::string> paths;
  const Value fontsInfo = registry.userFontsInfo();
  if (const Dictionary* info = fontsInfo.asDictionary()) {
    for (const auto& [path, record] : info->entries())
      if (providerOf(path) == provider) paths.push_back(path);
  }
  return paths;
}

// "--provider ID" at the front of `args`, taken off; empty when absent.
std::string takeProvider(std::vector<std::string>* args) {
  if (args->size() < 2 || (*args)[0] != "--provider") return {};
  std::string provider = (*args)[1];
  args->erase(args->begin(), args->begin() + 2);
  return provider;
}

int install(const ClientOptions& options, LinuxUserFontManager& registry,
            std::vector<std::string> args) {
  const std::string provider = takeProvider(&args);
  if (provider.empty() || args.empty()) return fail("install needs --provider ID and FILE...");
  std::string error;
  std::optional<std::vector<std::string>> paths = registry.installFontFiles(provider, args, &error);
  if (!paths) return fail(error + "; nothing was installed");
  registry.synchronizeFontProviders();
  return printChange("installed", *paths, notifyDaemon(options, true, *paths));
}

int removeProvider(const ClientOptions& options, LinuxUserFontManager& registry,
                   const std::string& provider) {
  const std::vector<std::string> paths = pathsOfProvider(registry, provider);
  Semaphore done;
  std::optional<std::string> error;
  registry.unregisterAndRemoveFontFilesForIdentifier(provider,
                                                     [&](const std::optional<std::string>& result) {
                                                       error = result;
                                                       done.signal();
                                                     });
  done.wait();
  if (error) return fail(*error);
  registry.synchronizeFontProviders();
  return printChange("removed", paths, paths.empty() || notifyDaemon(options, false, paths));
}

int remove(const ClientOptions& options, LinuxUserFontManager& registry,
           std::vector<std::string> args) {
  const std::string provider = takeProvider(&args);
  if (!provider.empty() && args.empty()) return removeProvider(options, registry, provider);
  if (!provider.empty() || args.empty()) return fail("remove needs PATH... or --provider ID");
  std::string error;
  if (!registry.removeFontFiles(args, &error)) return fail(error + "; nothing was removed");
  return printChange("removed", args, notifyDaemon(options, false, args));
}

int enableOrDisable(const ClientOptions& options, LinuxUserFontManager& registry,
                    const std::vector<std::string>& args, bool enabled) {
  if (args.empty()) return fail("enable and disable need PATH...");
  const Value info = registry.userFontsInfo();
  std::vector<std::string> urls;
  for (const std::string& path : args) {
    if (info.get(path).isNull()) return fail(path + ": the registry has no such font");
    urls.push_back(fileUrl(path));
  }
  registry.enableOrDisablePersistentURLs(urls, enabled);
  return printChange(enabled ? "enabled" : "disabled", args, notifyDaemon(options, enabled, args));
}

int list(LinuxUserFontManager& registry, std::vector<std::string> args) {
  const std::string provider = takeProvider(&args);
  if (!args.empty()) return fail("unexpected argument '" + args[0] + "'");
  ValueArray fonts;
  const Value fontsInfo = registry.userFontsInfo();
  if (const Dictionary* info = fontsInfo.asDictionary()) {
    for (const auto& [path, record] : info->entries()) {
      if (!provider.empty() && providerOf(path) != provider) continue;
      fonts.push_back(
          Value::dictionary({{"path", path},
                             {"provider", providerOf(path)},
                             {"enabled", !record.get("disabled").asBool().value_or(false)},
                             {"faces", record.get("familyName")}}));
    }
  }
  std::cout << JsonCodec::encode(Value(std::move(fonts))) << "\n";
  return 0;
}

}  // namespace

int runFontCommand(const ClientOptions& options, const std::string& root,
                   const std::vector<std::string>& args) {
  if (args.empty() || args[0] == "--help" || args[0] == "-h") {
    std::cout << kUsage;
    return args.empty() ? 2 : 0;
  }
  LinuxUserFontManager registry(root);
  registry.reset();
  const std::vector<std::string> rest(args.begin() + 1, args.end());
  if (args[0] == "install") return install(options, registry, rest);
  if (args[0] == "remove") return remove(options, registry, rest);
  if (args[0] == "enable") return enableOrDisable(options, registry, rest, true);
  if (args[0] == "disable") return enableOrDisable(options, registry, rest, false);
  if (args[0] == "list") return list(registry, rest);
  std::cerr << "typhoractl: unknown font command '" << args[0] << "'\n" << kUsage;
  return 2;
}

}  // namespace typhora::ctl
