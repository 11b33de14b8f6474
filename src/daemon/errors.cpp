#include "daemon/errors.h"

#include "daemon/log.h"

namespace kestrel {

std::optional<std::string> KSTError::localizedDescription() const {
  auto it = userInfo_.find(kKSTLocalizedDescriptionKey);
  if (it == userInfo_.end() || !it->second.isString()) return std::nullopt;
  return *it->second.string();
}

std::string KSTError::description() const {
  std::string text = "Error Domain=" + domain_ + " Code=" + std::to_string(code_);
  if (auto message = localizedDescription()) text += " \"" + *message + "\"";
  if (underlying_) text += " (underlying: " + underlying_->description() + ")";
  return text;
}

KSTErrorRef KSTCreateErrorArgs(const char* function, int line, std::string_view domain,
                               std::int64_t code, KSTErrorRef underlying,
                               const PlistDictionary* userInfo, bool log, const char* format,
                               const std::vector<FormatArg>& args) {
  PlistDictionary info = userInfo != nullptr ? *userInfo : PlistDictionary{};
  std::optional<std::string> message;
  if (format != nullptr) {
    message = formatMessageArgs(format, args);
    info[kKSTLocalizedDescriptionKey] = *message;
  }
  if (underlying) info[kKSTUnderlyingErrorKey] = underlying->description();
  info[kKSTFunctionNameKey] = std::string(function != nullptr ? function : "");
  info[kKSTSourceFileLineKey] = static_cast<std::int64_t>(line);

  if (log && message) {
    const std::string_view tag = function != nullptr ? function : "";
    if (underlying) {
      logFormatted(kLogError, tag, "%d: %@ (%@)", line, *message, underlying);
    } else {
      logFormatted(kLogError, tag, "%d: %@", line, *message);
    }
  }
  return std::make_shared<const KSTError>(std::string(domain), code, std::move(info),
                                          std::move(underlying));
}

KSTErrorRef KSTCreatePOSIXErrorArgs(const char* function, int line, int errnum,
                                    const char* format, const std::vector<FormatArg>& args) {
  return KSTCreateErrorArgs(function, line, kPOSIXErrorDomain, errnum, nullptr, nullptr, false,
                            format, args);
}

void KSTHandOverCode(const KSTErrorRef& error, std::uint64_t* code) {
  if (code == nullptr || !error) return;
  *code = static_cast<std::uint64_t>(
      static_cast<std::int64_t>(static_cast<std::int32_t>(error->code())));
}

}  // namespace kestrel
