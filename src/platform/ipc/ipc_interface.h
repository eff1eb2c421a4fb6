// Descriptions of IPC interfaces: each operation's wire name, argument types and whether it
// replies. The IPC layer refuses a message whose operation is unknown or whose arguments do not
// match, before any handler runs.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

// An argument or reply type. `nullable` admits a null (absent) value as well.
struct IpcType {
  enum class Kind { Any, Bool, Integer, Number, String, Data, Date, Array, Dictionary, Endpoint };
  Kind kind = Kind::Any;
  bool nullable = false;

  bool accepts(const Value& v) const;
  std::string description() const;
};

struct IpcOperation {
  std::string wireName;            // the full keyword name, colons included
  std::vector<IpcType> arguments;  // in order
  bool replies = false;            // false: one-way
  std::vector<IpcType> replyArguments;
};

class IpcInterface {
 public:
  IpcInterface(std::string name, std::vector<IpcOperation> operations);
  const std::string& name() const { return name_; }
  const IpcOperation* find(std::string_view wireName) const;
  const std::vector<IpcOperation>& operations() const { return operations_; }
  // Checks `arguments` against the operation; on mismatch answers false and says why.
  static bool matches(const IpcOperation& op, const std::vector<Value>& arguments,
                      std::string* why);

 private:
  std::string name_;
  std::vector<IpcOperation> operations_;
};

}  // namespace typhora
