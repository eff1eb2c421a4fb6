// One missing-fonts dialog: presents the font-install view service's controller with the dialog
// items, serves the view service's answer on an anonymous listener, and hands that answer to the
// completion exactly once: the first answer goes through, and a view service that cannot be
// made to listen, cannot be started, or goes away without answering counts as the answer
// "nothing chosen".
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>

#include "platform/ipc/ipc_listener.h"
#include "platform/value/value.h"

namespace typhora {

class TyphoraDaemon;

class MissingFontsDialogHandler final
    : public IpcListenerDelegate,
      public IpcExportedObject,
      public std::enable_shared_from_this<MissingFontsDialogHandler> {
 public:
  using CompletionHandler = std::function<void(const ValueArray& answer)>;

  // How long a view service that has ended may still take to be seen connecting: a connection
  // it made just before it ended reaches the listener after its end may have been noticed.
  static constexpr std::chrono::milliseconds kEndedGrace{2000};

  // `initWithTyphoraDaemon:completionHandler:`. The daemon is held weakly: it holds this handler.
  MissingFontsDialogHandler(std::weak_ptr<TyphoraDaemon> daemon,
                            CompletionHandler completionHandler);

  void showDialogWithUserInfo(const Value& userInfo);
  bool shouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;
  void doneWithMissingFonts(const ValueArray& answer);

  std::shared_ptr<TyphoraDaemon> daemon() const { return daemon_.lock(); }
  const CompletionHandler& completionHandler() const { return completionHandler_; }
  std::shared_ptr<IpcListener> listener() const;

 private:
  // The view service could not be started or has ended: unless it connected, it never answers.
  void viewServiceEnded();
  void answerNothingUnlessConnected();

  std::weak_ptr<TyphoraDaemon> daemon_;
  const CompletionHandler completionHandler_;
  mutable std::mutex mutex_;  // listener_ and answered_: set on the daemon's queue, cleared on
                              // the view service's connection queue
  std::shared_ptr<IpcListener> listener_;
  bool answered_ = false;
  bool connected_ = false;  // a view service connection was accepted
};

}  // namespace typhora
