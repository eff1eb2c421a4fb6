#include "notification_printer.h"

#include <iostream>

#include "platform/value/json_codec.h"

namespace typhora::ctl {

bool NotificationPrinter::invoke(const IpcOperation& /*operation*/,
                                 const std::vector<Value>& arguments, IpcReply /*reply*/) {
  if (format_) {
    std::cout << JsonCodec::encode(format_(arguments)) << std::endl;
  } else {
    std::vector<DictionaryEntry> fields{{"kind", arguments[1]}, {"name", arguments[0]}};
    if (!arguments[2].isNull()) fields.emplace_back("userInfo", arguments[2]);
    std::cout << JsonCodec::encode(Value(Dictionary(std::move(fields)))) << std::endl;
  }
  if (--remaining_ == 0) done_.signal();
  return true;
}

}  // namespace typhora::ctl
