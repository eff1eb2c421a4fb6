#include "platform/linux/proc_status.h"

#include <cstring>
#include <fstream>
#include <string>

namespace typhora {

long procStatusField(pid_t pid, const char* field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind(field, 0) == 0) return std::stol(line.substr(std::strlen(field)));
  }
  return -1;
}

}  // namespace typhora
