#include "ipc/interface_descriptions.h"

#include <utility>

namespace typhora {
namespace {

using Kind = IpcType::Kind;

IpcType t(Kind kind) {
  return IpcType{kind, false};
}
IpcType orAbsent(Kind kind) {
  return IpcType{kind, true};
}

IpcOperation call(const char* name, std::vector<IpcType> args, std::vector<IpcType> reply) {
  return IpcOperation{name, std::move(args), true, std::move(reply)};
}
IpcOperation oneWay(const char* name, std::vector<IpcType> args) {
  return IpcOperation{name, std::move(args), false, {}};
}

std::vector<IpcOperation> typhoraProtocolOperations() {
  return {
      call(op::kCheckin, {}, {orAbsent(Kind::Dictionary)}),
      call(op::kCheckinForFontPicker, {}, {orAbsent(Kind::Dictionary)}),
      call(op::kRequestFonts, {t(Kind::Array)}, {orAbsent(Kind::Dictionary)}),
      call(op::kRequestFontsForClient, {t(Kind::String), t(Kind::Endpoint)}, {t(Kind::Bool)}),
      call(op::kFontChanged, {t(Kind::Dictionary)}, {}),
      call(op::kUpdatingUserFonts, {}, {}),
      oneWay(op::kScheduleFontFilesDeletion, {t(Kind::Array)}),
      call(op::kSynchronizeFontAssets, {t(Kind::Array)},
           {t(Kind::Bool), orAbsent(Kind::Dictionary)}),
      call(op::kResetIssuedFontsFor, {t(Kind::String)}, {}),
  };
}

std::vector<IpcOperation> brisvelSupportOperations() {
  return {
      call(op::kCheckinForBrisvelProcess, {t(Kind::Endpoint)}, {}),
      call(op::kSendFonts, {t(Kind::Dictionary)}, {}),
  };
}

std::shared_ptr<const IpcInterface> make(const char* name, std::vector<IpcOperation> operations) {
  return std::make_shared<const IpcInterface>(name, std::move(operations));
}

}  // namespace

// Each description is a function-local static: built once, safely against concurrent first
// use, and shared by every connection after.

std::shared_ptr<const IpcInterface> typhoraDaemonProtocol() {
  static const auto description = [] {
    auto operations = typhoraProtocolOperations();
    for (auto& o : brisvelSupportOperations()) operations.push_back(std::move(o));
    return make("TyphoraDaemonProtocol", std::move(operations));
  }();
  return description;
}

std::shared_ptr<const IpcInterface> typhoraClientProtocol() {
  static const auto description = [] {
    return make("TyphoraClientProtocol",
                std::vector<IpcOperation>{oneWay(
                    op::kFontAddedInfo,
                    {orAbsent(Kind::Dictionary), orAbsent(Kind::Array), orAbsent(Kind::Array)})});
  }();
  return description;
}

std::shared_ptr<const IpcInterface> typhoraFontPickerClientSupportProtocol() {
  static const auto description = [] {
    return make(
        "TyphoraFontPickerClientSupportProtocol",
        std::vector<IpcOperation>{
            call(op::kPing, {t(Kind::String)}, {orAbsent(Kind::String)}),
            call(op::kActivateFontsForFontPickerClient, {t(Kind::Dictionary)}, {t(Kind::Bool)}),
        });
  }();
  return description;
}

std::shared_ptr<const IpcInterface> typhoraBrisvelSupportServerProtocol() {
  static const auto description = [] {
    return make("TyphoraBrisvelSupportServerProtocol",
                std::vector<IpcOperation>{
                    call(op::kBrisvelPing, {}, {orAbsent(Kind::String)}),
                    call(op::kUserInstalledFontsInfo, {orAbsent(Kind::Dictionary)}, {}),
                });
  }();
  return description;
}

std::shared_ptr<const IpcInterface> fontInstallViewServiceProtocol() {
  static const auto description = [] {
    return make("FontInstallViewServiceProtocol",
                std::vector<IpcOperation>{
                    oneWay(op::kDoneWithInstallFonts, {t(Kind::Bool)}),
                    oneWay(op::kDoneWithMissingFonts, {orAbsent(Kind::Array)}),
                    oneWay(op::kDoneWithDeleteAppFonts, {t(Kind::Bool)}),
                });
  }();
  return description;
}

}  // namespace typhora
