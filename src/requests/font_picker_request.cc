// The font picker's request: the fonts of one family delivered straight to a client application
// over the endpoint it handed the picker, and recorded as issued to that client.
#include "catalog/font_record.h"
#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kConnectionInvalidated = "requestFonts:forClient: connection invalidated.";
constexpr const char* kLumoError = "lumo error: %s - %@";
constexpr const char* kErrorSite = "-[TyphoraDaemon requestFonts:forClient:reply:]_block_invoke_2";

}  // namespace

void TyphoraDaemon::requestFonts(const std::string& name,
                                 std::shared_ptr<const IpcEndpoint> forClient,
                                 const IpcReply& reply) {
  std::shared_ptr<IpcConnection> connection = platform_.ipc.connect(std::move(forClient));
  connection->setRemoteInterface(typhoraFontPickerClientSupportProtocol());
  connection->setInvalidationHandler([] { SystemLog(kConnectionInvalidated); });
  connection->resume();
  auto client = connection->synchronousRemoteObjectProxy(
      [](const std::string& error) { SystemLog(kLumoError, kErrorSite, error); });
  // A client that never answers must not hold this thread for good: cutting the connection off
  // ends the call that waits.
  std::weak_ptr<IpcConnection> weakConnection = connection;
  platform_.clock.schedule(kFontPickerClientTimeout, Duration::zero(), [weakConnection] {
    if (auto late = weakConnection.lock()) late->invalidate();
  });

  bool answered = false;
  std::optional<std::string> family;
  providerIdentifiersAndFamilyName(&family, name);
  if (family) {
    client->call(op::kPing, {Value("")}, [](std::vector<Value>) {});
    const AuditToken token = connection->auditToken();
    Value fonts = filterUserFontInfoForAuditToken(
        token, false, [&family](const std::string&, const Value& record, bool*) {
          return FontRecord::hasFamily(record, *family);
        });
    if (!fonts.asDictionary()->empty()) {
      client->call(op::kActivateFontsForFontPickerClient, {fonts},
                   [&answered, &reply](std::vector<Value> values) {
                     reply({Value(!values.empty() && values[0].asBool() == true)});
                     answered = true;
                   });
      std::optional<CodeSigningRecord> record = platform_.codeSigning.codeSigningRecord(token);
      if (record && record->signingIdentifier()) {
        std::vector<std::string> paths;
        for (const auto& entry : fonts.asDictionary()->entries()) paths.push_back(entry.first);
        recordIssuedFontPaths(paths, record->signingIdentifier());
      }
    }
  }
  if (!answered) reply({Value(false)});
  connection->invalidate();
}

}  // namespace typhora
