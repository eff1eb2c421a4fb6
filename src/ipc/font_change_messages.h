// What the checked-in clients are told of one font change, made once per change and capability
// class instead of once per client. Every enumerating client sees the same fonts of a change, and
// so does every provider of one directory that is sandboxed alike: each class's fonts are looked
// up once, and its message is encoded once and queued on every client's connection. Only a
// provider's token for its own directory is made per process, and a message that carries one is
// encoded for that process alone. A profile change tells every client the same.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/ipc/ipc_connection.h"
#include "platform/ipc/ipc_shared_message.h"
#include "platform/value/value.h"

namespace typhora {

class TyphoraDaemon;
class TyphoraHandler;

class FontChangeMessages {
 public:
  FontChangeMessages(TyphoraDaemon& daemon, Value change);
  FontChangeMessages(const FontChangeMessages&) = delete;
  FontChangeMessages& operator=(const FontChangeMessages&) = delete;

  const Value& change() const { return change_; }
  // Sends the client of `handler` what it may see of the change, if anything. On
  // mainHandlerQueue, like every lookup it makes.
  void sendTo(const TyphoraHandler& handler);

 private:
  struct NamedPath {
    std::string url;
    std::string path;
  };
  // What one class of clients receives of a user-fonts addition.
  struct ClassFonts {
    Value fontsInfo;
    std::optional<std::string> foundDirectory;  // a provider's directory, when it has fonts in it
    std::shared_ptr<const IpcSharedMessage> message;  // for the clients that get no token
  };

  void sendUserFonts(const TyphoraHandler& handler, IpcConnection* connection);
  void sendProviderAddition(const TyphoraHandler& handler, IpcConnection& connection);
  void sendProfileFonts(IpcConnection& connection);
  const std::shared_ptr<const IpcSharedMessage>& enumeratingAddition(const TyphoraHandler& handler,
                                                                     IpcConnection& connection);
  static std::shared_ptr<const IpcSharedMessage> message(Value info,
                                                         const std::vector<std::string>& urls,
                                                         bool added);

  TyphoraDaemon& daemon_;
  const Value change_;
  const bool added_;
  const bool profile_;
  std::vector<NamedPath> named_;  // every URL of the change that names a path
  // Of those, for an addition: the paths that name no font, and the URLs of those that do.
  std::vector<std::string> invalid_;
  std::vector<NamedPath> fonts_;
  std::shared_ptr<const IpcSharedMessage> everyone_;  // a removal, or a profile change
  std::shared_ptr<const IpcSharedMessage> enumerating_;
  std::map<std::string, ClassFonts> providers_;  // by directory and sandbox
};

}  // namespace typhora
