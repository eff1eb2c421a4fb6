#include "platform/ipc/ipc_interface.h"

namespace typhora {

bool IpcType::accepts(const Value& v) const {
  if (v.isNull()) return nullable || kind == Kind::Any;
  switch (kind) {
    case Kind::Any:
      return true;
    case Kind::Bool:
      return v.type() == Value::Type::Bool;
    case Kind::Integer:
      return v.type() == Value::Type::Int || v.type() == Value::Type::UInt;
    case Kind::Number:
      return v.isNumber();
    case Kind::String:
      return v.type() == Value::Type::String;
    case Kind::Data:
      return v.type() == Value::Type::Data;
    case Kind::Date:
      return v.type() == Value::Type::Date;
    case Kind::Array:
      return v.type() == Value::Type::Array;
    case Kind::Dictionary:
      return v.type() == Value::Type::Dictionary;
    case Kind::Endpoint:
      return v.type() == Value::Type::Endpoint;
  }
  return false;
}

std::string IpcType::description() const {
  static constexpr const char* names[] = {"any",  "boolean", "integer", "number",     "string",
                                          "data", "date",    "array",   "dictionary", "endpoint"};
  std::string name = names[static_cast<int>(kind)];
  return nullable ? name + " or absent" : name;
}

IpcInterface::IpcInterface(std::string name, std::vector<IpcOperation> operations)
    : name_(std::move(name)), operations_(std::move(operations)) {}

const IpcOperation* IpcInterface::find(std::string_view wireName) const {
  for (const auto& op : operations_) {
    if (op.wireName == wireName) return &op;
  }
  return nullptr;
}

bool IpcInterface::matches(const IpcOperation& op, const std::vector<Value>& arguments,
                           std::string* why) {
  if (arguments.size() != op.arguments.size()) {
    if (why != nullptr) {
      *why = op.wireName + " takes " + std::to_string(op.arguments.size()) + " argument(s), got " +
             std::to_string(arguments.size());
    }
    return false;
  }
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    if (!op.arguments[i].accepts(arguments[i])) {
      if (why != nullptr) {
        *why = op.wireName + " argument " + std::to_string(i + 1) + " must be " +
               op.arguments[i].description();
      }
      return false;
    }
  }
  return true;
}

}  // namespace typhora
