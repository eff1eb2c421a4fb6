// The one daemon object. It owns every piece of shared state, the queues that guard it, and the
// start-up order; each subsystem's operations are defined in that subsystem's folder.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "catalog/user_fonts_name_index.h"
#include "ipc/local_notification_center.h"
#include "platform/dispatch/one_shot_timer.h"
#include "platform/dispatch/serial_queue.h"
#include "platform/ipc/ipc_listener.h"
#include "platform/platform.h"
#include "platform/storage/file_stamp.h"
#include "platform/value/value.h"
#include "requests/request_fonts_gate.h"

namespace typhora {

class TyphoraHandler;
class MissingFontsDialogHandler;
class FontChangeMessages;

inline constexpr const char* kServiceName = "com.zorvane.typhorad";
inline constexpr const char* kMainHandlerQueueLabel = "com.zorvane.typhorad";
inline constexpr const char* kUpdatingUserFontsQueueLabel = "com.zorvane.typhora.UpdatingUserFonts";
// The keys of a font request record: a family name, a PostScript name, or both.
inline constexpr const char* kSVFontFamilyNameAttribute = "SVFontFamilyAttribute";
inline constexpr const char* kSVFontNameAttribute = "SVFontNameAttribute";

class TyphoraDaemon final : public IpcListenerDelegate,
                            public std::enable_shared_from_this<TyphoraDaemon> {
 public:
  // `init`: creates mainHandlerQueue and nothing else. Tests make as many daemons as they like.
  explicit TyphoraDaemon(Platform& platform);
  ~TyphoraDaemon() override;
  TyphoraDaemon(const TyphoraDaemon&) = delete;
  TyphoraDaemon& operator=(const TyphoraDaemon&) = delete;

  // --- Daemon core: the process-wide daemon, start-up and the run loop (daemon/) ---

  // The platform sharedDaemon() builds its daemon on; main installs it before the first call.
  static void installPlatform(Platform& platform);
  // The one daemon of the process, made by the first call (safe against concurrent first calls).
  static TyphoraDaemon& sharedDaemon();

  // Start-up steps 2 to 7, in their fixed order, on the main thread.
  // False when the service cannot be opened: the daemon then has nothing to serve.
  bool startUp();
  bool setupForLumoService();
  void setupForScheduledFontDeletion();
  void setupForDistributedNotifications();
  void setupForBlacklistUpdatedNotification();
  void setupForMonitoringFontAssets();
  // The preferences migration.
  void setup();
  // Hands the main thread to the main queue for good.
  [[noreturn]] void run();

  SerialQueue& mainHandlerQueue() const { return *mainHandlerQueue_; }

  // --- System event subscriptions (daemon/system_events.cc) ---

  // Handles one event of the distributed-notification stream, on the main queue: removed
  // applications lose their fonts and their ledger entries.
  void handleDistributedNotification(const Value& event);
  void synchronizeFontProviders();
  Platform& platform() const { return platform_; }

  // --- Font paths and the update queue (daemon/paths.cc) ---

  // Runs `reply` as one job on the update queue and returns once it has run. Never call it from
  // a job that already runs on the update queue.
  void updatingUserFonts(const std::function<void()>& reply);

  // --- Client connections (ipc/) ---

  bool shouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;
  // Carries out an operation that a connection's handler does not serve itself, on the calling
  // thread, with the caller's connection still current. False when the daemon does not implement
  // the operation: the call is then refused as unrecognised.
  bool forwardInvocation(const IpcOperation& operation, const std::vector<Value>& arguments,
                         const IpcReply& reply);
  // IPC: the registry reports changed fonts; every checked-in client is told what it may see.
  void fontChanged(const Value& change, const IpcReply& reply);
  // The messages of `change`: those of the change being posted, shared by every handler it
  // reaches, or made for the caller alone. On mainHandlerQueue.
  std::shared_ptr<FontChangeMessages> fontChangeMessages(const Value& change);
  LocalNotificationCenter& localNotificationCenter() { return localNotificationCenter_; }
  // The handlers of the connections still open.
  std::vector<std::shared_ptr<TyphoraHandler>> liveHandlers();

  // --- Status and grants for the platform's operators (daemon/status_report.cc) ---
  // Built from the calling thread without waiting for any queue, so a busy daemon still answers.

  // Uptime, connections, the request gate, the cache, pending deletions, the block list and the
  // depth of each queue.
  Value statusReport();
  // The issued-fonts ledger with its paths expanded: every application, or only `identifier`.
  Value grantsReport(const std::optional<std::string>& identifier);

  // --- Font catalog: the user-fonts information (catalog/user_fonts_store.cc) ---

  // Loads the cache when it is absent; true when it holds at least one entry.
  bool isUserFontInstalled();
  // The cached user-fonts information (shared, never copied), or null when there is none.
  Value userFontsInfo();
  void setUserFontsInfo(Value info);
  // Drops the cache; the next reader loads the file again. Answers what was dropped, for a caller
  // in a hurry to free later (ten thousand records take a millisecond).
  Value invalidateUserFonts();
  // How many times the cache was dropped.
  std::uint64_t userFontsGeneration();
  bool isUserFontsInfoCached();
  // Reads the user-fonts file on the update queue: the dictionary, or null. A file unchanged since
  // it was last read (see FileSystem::stampOf) answers the dictionary read then, not decoded again.
  Value _userFontsInfoFromDisk();
  // The daemon's path of the user-fonts file.
  static std::string userFontsFilePath();
  // The names of the loaded information, indexed by the first look-up after a load and dropped
  // with the cache.
  std::shared_ptr<const UserFontsNameIndex> userFontsNameIndex();
  // The enabled entries, the cached records themselves, as every enumerating caller receives
  // them: filtered by the first such caller after a load and dropped with the cache.
  Value enabledUserFontsInfo();

  // --- Font catalog: name resolution (catalog/name_resolution.cc) ---
  // Every look-up answers as a walk of the cached user-fonts information in its order (by path)
  // would, through the name index; names are compared exactly.

  bool isKnownFamilyName(const std::string& familyName, bool* withEnabledState);
  std::optional<std::string> knownFamilyNameFromPostScriptName(const std::string& postScriptName,
                                                               bool* withEnabledState);
  // Sorts request records into enabled and disabled families and answers the unknown names,
  // sorted. Either out-argument may be null.
  std::vector<std::string> unknownFontNamesAndEnabledFamilyNames(
      std::vector<std::string>* enabledFamilyNames,
      std::vector<std::string>* andDisabledFamilyNames, const ValueArray& fromRequests);
  std::optional<std::string> identifierFromFilePath(const std::string& path);
  std::set<std::string> providerIdentifiersFromFamilyName(const std::string& familyName);
  std::set<std::string> providerIdentifiersAndFamilyName(std::optional<std::string>* familyName,
                                                         const std::string& fromPostScriptName);

  // --- Font requests (requests/font_requests.cc, requests/font_picker_request.cc) ---

  // IPC: the caller's fonts of the requested families and PostScript names, after the user's
  // choice in the missing-fonts dialog when some are unknown or disabled. One request at a time
  // passes the gate; the reply is called exactly once.
  void requestFonts(const ValueArray& requests, const IpcReply& reply);
  // IPC: delivers the fonts of the family of PostScript font `name` to the font-picker client
  // at `forClient`; replies with the client's answer, or false.
  void requestFonts(const std::string& name, std::shared_ptr<const IpcEndpoint> forClient,
                    const IpcReply& reply);
  // The gate's one second after an answer, before the next request may pass.
  static constexpr Duration kRequestFontsGateDelay = std::chrono::seconds(1);
  // The longest a font-picker client may take to answer each call.
  static constexpr Duration kFontPickerClientTimeout = std::chrono::seconds(10);
  const RequestFontsGate& requestFontsGate() const { return requestFontsGate_; }

  // --- Font requests: the missing-fonts dialog (requests/missing_fonts_dialog.cc) ---

  ValueArray missingFontsDialogRequestsFromUnknownFontNames(const std::vector<std::string>& names);
  ValueArray missingFontsDialogRequestsFromDisabledFamilyNames(
      const std::vector<std::string>& familyNames);
  // Presents the dialog when process `forPID` is in the foreground; otherwise the completion runs
  // at once with an empty answer. Runs on mainHandlerQueue and does not wait for the user.
  void showDialog(const ValueArray& items, std::int32_t forPID,
                  std::function<void(const ValueArray& answer)> completionHandler);
  std::shared_ptr<MissingFontsDialogHandler> missingFontsDialogHandler() const;

  // --- Font requests: analytics (requests/request_analytics.cc) ---

  void analyticsEventRequestFonts(const std::string& identifier, std::uint64_t misses,
                                  std::uint64_t suggestions, std::uint64_t resolved);
  // Counts a request in the persistent counters "missed" and "resolved".
  void recordRequestFontsResultWihtMissed(bool missed, bool andResolved);
  // Hands back both counters and resets them.
  void extractRequestFontsMissed(std::uint64_t* missed, std::uint64_t* andResolved);

  // --- Access control: capabilities (access/capabilities.cc) ---

  // The caller's capabilities from its signing record; all four out-arguments are always written
  // (false, false, false and absent when no record can be made).
  void capabilitiesFor(const AuditToken& token, bool* allowEnumerate, bool* allowUserFonts,
                       bool* allowInstallation, std::optional<std::string>* andIdentifier);
  // False when the block list refuses the application's current short version.
  bool isIdentifierAllowed(const std::string& identifier);
  bool isAuditTokenSandboxed(const AuditToken& token);
  // Whether the peer of the current connection is the system font picker.
  bool isCurrentConnectionFontPicker();

  // --- Access control: sandbox extensions and filtering (access/sandbox_extensions.cc) ---

  // Decides per entry whether a caller gets it; setting `covered` says another token already
  // opens the file.
  using FontFilter =
      std::function<bool(const std::string& path, const Value& record, bool* covered)>;

  // Extension token values (data: the token text and its terminating zero byte), or null.
  Value sandboxExtensionForEnumeration(const AuditToken& token);
  Value sandboxExtensionForFontAssets(const AuditToken& token);
  Value sandboxExtensionForProvider(const AuditToken& token, const std::string& withDirectoryName);
  // The user-fonts entries the filter keeps, as this process may receive them (a dictionary).
  Value filterUserFontInfoForAuditToken(const AuditToken& token, bool withEnumerationCapability,
                                        const FontFilter& withFilter);
  Value fontInfoForAuditToken(const AuditToken& token, bool withEnumuration, bool installation,
                              const std::optional<std::string>& identifier,
                              const std::optional<std::set<std::string>>& andFileFilters,
                              std::optional<std::string>* foundFontDirectoryName);
  // Builds the check-in dictionary on mainHandlerQueue and replies from there; replies absent at
  // once when no capability is set. Never call it from mainHandlerQueue.
  void setupUserInstalledFontsFor(const AuditToken& token, const AuditToken& withCapabilitiesFor,
                                  bool hasEnumeration, bool hasFontAccess, bool isFontProvider,
                                  const std::optional<std::string>& processIdentifier,
                                  const IpcReply& reply);

  // The font-access block list. The only field read and written without mainHandlerQueue.
  Value blacklistInfo() const;
  void setBlacklistInfo(Value list);

  // --- Issued-fonts ledger (ledger/issued_font_paths.cc) ---
  // The paths issued to each application, in the preference "issues". Every operation reads and
  // writes the whole dictionary under ledgerMutex_, from whichever queue calls it.

  // The stored forms of the paths that are keys of the user-fonts information, without repeats.
  std::vector<std::string> sanitizeIssuedFontPaths(const std::vector<std::string>& paths);
  void recordIssuedFontPaths(const std::optional<std::vector<std::string>>& paths,
                             const std::optional<std::string>& forIdentifier);
  // The absolute paths issued to `identifier`; empty when it has no entry.
  std::vector<std::string> issuedFontFilePathsForIdentifier(const std::string& identifier);
  void forgetClientApplication(const std::optional<std::string>& identifier);
  // IPC: forgets `identifier`'s entry when the caller holds the reset entitlement; always replies.
  void resetIssuedFontsFor(const std::string& identifier, const IpcReply& reply);

  // --- Font files and assets: scheduled deletion (maintenance/scheduled_deletion.cc) ---

  // The deletion queue (process-wide, made on first use); every change to the pending table
  // "delete" and to the timer happens on it.
  SerialQueue& scheduledFontDeletionQueue();
  // The deletion timer, or null; read it on the deletion queue.
  std::shared_ptr<OneShotTimer> scheduledFontDeletionTimer() const;
  // IPC, one-way: schedules font files for deletion after the delay.
  void scheduleFontFilesDeletion(const std::vector<std::string>& paths);
  void setFontFilesDeletionTimer(std::uint32_t seconds);
  void stopFontFilesDeletionTimer();
  void executeScheduledFontFilesDeletion(const std::shared_ptr<OneShotTimer>& timer);

  // --- Font files and assets: asset synchronisation (maintenance/font_assets.cc) ---

  // IPC: the registry's information on the mirrored copies of the named asset-store files,
  // synchronising first when fewer are mirrored than named, and a token for the mirror.
  void synchronizeFontAssets(const std::vector<std::string>& paths, const IpcReply& reply);
  // The process-wide queue that watches the asset store (made on first use, never released).
  static std::shared_ptr<SerialQueue> fontAssetsMonitorQueue();

  // --- Font files and assets: the asset catalog (maintenance/asset_catalog.cc) ---

  // The block list's loading queue, made on first use and kept for the process.
  SerialQueue& assetHandlerQueue();
  // Loads the block list from the asset catalog; runs on assetHandlerQueue.
  void loadBlacklist();
  // The catalog-update activity's handler.
  void checkAssetUpdate(ScheduledActivityState state);

 private:
  // What a font request knows of its caller from the moment it enters.
  struct RequestFontsCaller {
    AuditToken token;
    std::string identifier;
    bool enumeration = false;
  };

  void admitRequestFonts(const ValueArray& requests, const RequestFontsCaller& caller,
                         const std::weak_ptr<IpcConnection>& connection, const IpcReply& reply);
  void resolveRequestFonts(const ValueArray& requests, const RequestFontsCaller& caller,
                           const IpcReply& reply);
  void completeRequestFonts(const RequestFontsCaller& caller, const Value& firstAnswer,
                            const ValueArray& answer, const IpcReply& reply);
  // Returns the gate's permit `after` from now, through the main queue.
  void releaseRequestFontsGate(Duration after);

  SerialQueue& updateQueue();
  // Scheduled deletion's steps, on scheduledFontDeletionQueue: adding to the pending table
  // (bounded, refusing paths that are not plain), and removing the due files.
  void addPendingDeletions(const std::vector<std::string>& paths, std::uint32_t delay);
  void removeDueFontFiles(const std::vector<std::string>& due);
  // filterUserFontInfoForAuditToken over the entries at `onlyPaths` alone (looked up, in path
  // order, as the walk would meet them), or over every entry when it is null.
  Value filterUserFontEntries(const AuditToken& token, bool withEnumerationCapability,
                              const FontFilter& withFilter, const std::set<std::string>* onlyPaths);
  // The cache, loaded from disk when absent. Called with userFontsInfoMutex_ held.
  const Value& loadedUserFontsInfoLocked();
  std::vector<std::string> issuedFontFilePathsLocked(const Dictionary* issues,
                                                     const std::string& identifier);
  void writeIssues(std::vector<DictionaryEntry> entries);

  Platform& platform_;

  // Fields, in the order of the daemon's data model.
  mutable std::mutex blacklistInfoMutex_;
  Value blacklistInfo_;
  std::shared_ptr<SerialQueue> mainHandlerQueue_;
  // The cache is read on mainHandlerQueue, on IPC threads and at start-up on the main thread.
  // A mutex held across the load makes concurrent first readers wait for one read of the file
  // instead of each reading it; no other lock is ever taken while holding it, and the update
  // queue's jobs never take it, so it cannot deadlock.
  std::mutex userFontsInfoMutex_;
  Value userFontsInfo_;
  // Derived from userFontsInfo_ when first asked for; null whenever the cache is.
  std::shared_ptr<const UserFontsNameIndex> userFontsNameIndex_;
  Value enabledUserFontsInfo_;
  std::uint64_t userFontsGeneration_ = 0;  // cache drops so far, for status reports
  // The information as last decoded from the file and the file's stamp then, kept across drops:
  // a file that has not changed since is not decoded again. Touched only by jobs on the update
  // queue.
  struct UserFontsRead {
    Value info;
    std::optional<FileStamp> stamp;
  };
  UserFontsRead lastRead_;

  // The handlers of accepted connections, pruned as their connections end.
  std::mutex handlersMutex_;
  std::vector<std::weak_ptr<TyphoraHandler>> handlers_;
  const std::chrono::steady_clock::time_point startedAt_ = std::chrono::steady_clock::now();

  // Only keeps the service listener open for the life of the process; nothing reads it.
  std::shared_ptr<IpcListener> listener_;

  // Serialises the counters' read-modify-write ("missed", "resolved").
  std::mutex requestCountersMutex_;
  // Serialises the ledger's read-modify-write of "issues" across the queues that reach it.
  std::mutex ledgerMutex_;

  LocalNotificationCenter localNotificationCenter_;
  // The font change being posted to the handlers; touched only on mainHandlerQueue.
  std::shared_ptr<FontChangeMessages> fontChangeMessages_;
  RequestFontsGate requestFontsGate_;
  // The most recent dialog's handler; replaced on mainHandlerQueue by the next dialog.
  std::shared_ptr<MissingFontsDialogHandler> missingFontsDialogHandler_;

  // The deletion timer: touched only on scheduledFontDeletionQueue.
  std::shared_ptr<OneShotTimer> scheduledFontDeletionTimer_;

  std::once_flag updateQueueOnce_;
  std::shared_ptr<SerialQueue> updateQueue_;
};

}  // namespace typhora
