#include "requests/missing_fonts_dialog_handler.h"

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kViewService = "com.zorvane.FontInstallViewService";
constexpr const char* kController = "FontInstallMissingController";
constexpr const char* kNoListener =
    "missing fonts dialog: no listener for the view service's answer; nothing is chosen";

}  // namespace

MissingFontsDialogHandler::MissingFontsDialogHandler(std::weak_ptr<TyphoraDaemon> daemon,
                                                     CompletionHandler completionHandler)
    : daemon_(std::move(daemon)), completionHandler_(std::move(completionHandler)) {}

std::shared_ptr<IpcListener> MissingFontsDialogHandler::listener() const {
  std::lock_guard lock(mutex_);
  return listener_;
}

void MissingFontsDialogHandler::showDialogWithUserInfo(const Value& userInfo) {
  auto server = daemon_.lock();
  if (!server) return;
  Platform& platform = server->platform();
  std::shared_ptr<IpcListener> listener = platform.ipc.makeAnonymousListener();
  if (!listener) {
    // Out of descriptors, for instance: no view service could answer.
    TYLog_Error(kTYLogTyphoraDaemon, kNoListener);
    doneWithMissingFonts({});
    return;
  }
  listener->setDelegate(weak_from_this());
  auto handle =
      platform.remoteAlert.makeHandle({kViewService, kController}, {listener->endpoint()});
  {
    std::lock_guard lock(mutex_);
    listener_ = listener;
  }
  listener->resume();
  std::weak_ptr<MissingFontsDialogHandler> weak = weak_from_this();
  handle->activate(userInfo, [weak] {
    if (auto handler = weak.lock()) handler->viewServiceEnded();
  });
}

void MissingFontsDialogHandler::viewServiceEnded() {
  auto server = daemon_.lock();
  if (!server) return;
  // Once connected, the connection's end decides; before, give a connection the view service
  // made just before it ended the time to be accepted.
  std::weak_ptr<MissingFontsDialogHandler> weak = weak_from_this();
  server->platform().clock.schedule(kEndedGrace, Duration::zero(), [weak] {
    if (auto handler = weak.lock()) handler->answerNothingUnlessConnected();
  });
}

void MissingFontsDialogHandler::answerNothingUnlessConnected() {
  {
    std::lock_guard lock(mutex_);
    if (connected_) return;
  }
  doneWithMissingFonts({});
}

bool MissingFontsDialogHandler::shouldAcceptNewConnection(
    IpcListener& /*listener*/, std::shared_ptr<IpcConnection> connection) {
  {
    std::lock_guard lock(mutex_);
    connected_ = true;
  }
  connection->setExportedInterface(fontInstallViewServiceProtocol());
  connection->setExportedObject(shared_from_this());
  // A view service that goes away without an answer must not leave the request waiting.
  std::weak_ptr<MissingFontsDialogHandler> weak = weak_from_this();
  connection->setInvalidationHandler([weak] {
    if (auto handler = weak.lock()) handler->doneWithMissingFonts({});
  });
  connection->resume();
  return true;
}

bool MissingFontsDialogHandler::invoke(const IpcOperation& operation,
                                       const std::vector<Value>& arguments, IpcReply /*reply*/) {
  if (operation.wireName != op::kDoneWithMissingFonts) return false;
  const ValueArray* answer = arguments.at(0).asArray();
  doneWithMissingFonts(answer != nullptr ? *answer : ValueArray{});
  return true;
}

void MissingFontsDialogHandler::doneWithMissingFonts(const ValueArray& answer) {
  std::shared_ptr<IpcListener> listener;
  {
    std::lock_guard lock(mutex_);
    if (answered_) return;  // only the first answer goes through
    answered_ = true;
    listener = std::move(listener_);
  }
  if (completionHandler_) completionHandler_(answer);
  if (listener) listener->invalidate();
}

}  // namespace typhora
