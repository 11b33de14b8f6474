#include "platform/application_lifecycle.h"

namespace kestrel::platform {

std::string TerminationReport::description() const {
  std::string text;
  if (ended.empty()) {
    text = "no process running";
  } else {
    text = "ended " + std::to_string(ended.size()) +
           (ended.size() == 1 ? " process (" : " processes (");
    for (std::size_t i = 0; i < ended.size(); ++i) {
      text += (i == 0 ? "pid " : ", pid ") + std::to_string(ended[i].pid);
      if (ended[i].killed) text += " killed";
    }
    text += ")";
  }
  if (error) text += "; " + *error;
  return text;
}

}  // namespace kestrel::platform
