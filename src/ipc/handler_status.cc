// A client connection as the daemon's status report shows it.
#include "ipc/typhora_handler.h"

namespace typhora {

Value TyphoraHandler::statusRecord() const {
  std::lock_guard lock(mutex_);
  const AuditToken peer = clientConnection_ ? clientConnection_->auditToken() : AuditToken{};
  std::vector<DictionaryEntry> fields{
      {"pid", static_cast<std::int64_t>(peer.pid)},
      {"uid", static_cast<std::int64_t>(peer.uid)},
      {"checkedIn", checkedIn_},
      {"capabilities", Value::dictionary({{"enumeration", hasEnumerationEntitlement_},
                                          {"fontAccess", hasFontAccessEntitlement_},
                                          {"provider", isFontProvider_}})},
      {"webContentConnections",
       static_cast<std::int64_t>(
           webcontentProcessConnections_ ? webcontentProcessConnections_->size() : 0)}};
  if (signingIdentifier_) fields.emplace_back("identifier", *signingIdentifier_);
  return Value(Dictionary(std::move(fields)));
}

}  // namespace typhora
