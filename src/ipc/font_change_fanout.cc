// Font changes reported by the registry: the cache is dropped, every checked-in handler tells its
// client what it may see of the change, and the change is announced system-wide. The messages of
// one change are made once per class of clients (FontChangeMessages) while it is posted.
#include "daemon/typhora_daemon.h"
#include "ipc/font_change_messages.h"
#include "ipc/typhora_handler.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kFontChangedName = "fontChanged";
constexpr const char* kReceived = "received fontChanged notification.";

}  // namespace

void TyphoraDaemon::fontChanged(const Value& change, const IpcReply& reply) {
  TYLog_Debug(kTYLogTyphoraDaemon, kReceived);
  mainHandlerQueue().async([self = shared_from_this(), change] {
    // Freed once the clients have been written to.
    const Value dropped = self->invalidateUserFonts();
    self->fontChangeMessages_ = std::make_shared<FontChangeMessages>(*self, change);
    self->localNotificationCenter().post(kFontChangedName, self->fontChangeMessages_->change());
    self->fontChangeMessages_.reset();
    self->platform_.systemNotify.post(FontProviderDidChangeDistributedNotification);
  });
  reply({});
}

std::shared_ptr<FontChangeMessages> TyphoraDaemon::fontChangeMessages(const Value& change) {
  TY_ASSERT_ON_QUEUE(mainHandlerQueue());
  // The handlers of a post are given the posted value itself.
  if (fontChangeMessages_ && &fontChangeMessages_->change() == &change) return fontChangeMessages_;
  return std::make_shared<FontChangeMessages>(*this, change);
}

void TyphoraHandler::observeFontChanges() {
  std::weak_ptr<TyphoraHandler> weak = weak_from_this();
  server_->localNotificationCenter().addObserver(this, kFontChangedName,
                                                 [weak](const Value& change) {
                                                   if (auto handler = weak.lock())
                                                     handler->fontChanged(change);
                                                 });
}

void TyphoraHandler::fontChanged(const Value& change) {
  TY_ASSERT_ON_QUEUE(server_->mainHandlerQueue());
  server_->fontChangeMessages(change)->sendTo(*this);
}

}  // namespace typhora
