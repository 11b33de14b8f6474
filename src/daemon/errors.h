// Error objects and the code hand-over.
//
// Every operation reports failure through a uint64_t* code that the caller
// presets to kKSTSuccess and that is written only on failure. Where an
// operation needs to say more, it builds an error object through KST_ERROR /
// KST_POSIX_ERROR, which capture the failing function's name and line, and
// hands the object's code to the caller with KSTHandOverCode.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "daemon/error_codes.h"
#include "platform/format.h"
#include "platform/plist.h"

namespace kestrel {

inline constexpr const char* kKSTErrorDomain = "KSTErrorDomain";
inline constexpr const char* kPOSIXErrorDomain = "POSIXErrorDomain";

// User-info keys of an error object.
inline constexpr const char* kKSTLocalizedDescriptionKey = "LocalizedDescription";
inline constexpr const char* kKSTUnderlyingErrorKey = "UnderlyingError";
inline constexpr const char* kKSTFunctionNameKey = "FunctionName";
inline constexpr const char* kKSTSourceFileLineKey = "SourceFileLine";

class KSTError;
using KSTErrorRef = std::shared_ptr<const KSTError>;

class KSTError {
 public:
  KSTError(std::string domain, std::int64_t code, PlistDictionary userInfo, KSTErrorRef underlying)
      : domain_(std::move(domain)),
        code_(code),
        userInfo_(std::move(userInfo)),
        underlying_(std::move(underlying)) {}

  const std::string& domain() const { return domain_; }
  std::int64_t code() const { return code_; }
  // The caller's entries plus the description, "FunctionName" and "SourceFileLine".
  // The underlying error is kept beside it (underlyingError()).
  const PlistDictionary& userInfo() const { return userInfo_; }
  const KSTErrorRef& underlyingError() const { return underlying_; }
  std::optional<std::string> localizedDescription() const;
  bool isPOSIXError(int errnum) const { return domain_ == kPOSIXErrorDomain && code_ == errnum; }

  // "Error Domain=KSTErrorDomain Code=21 "message"", with the underlying error after it.
  std::string description() const;

 private:
  std::string domain_;
  std::int64_t code_;
  PlistDictionary userInfo_;
  KSTErrorRef underlying_;
};

KSTErrorRef KSTCreateErrorArgs(const char* function, int line, std::string_view domain,
                               std::int64_t code, KSTErrorRef underlying,
                               const PlistDictionary* userInfo, bool log, const char* format,
                               const std::vector<FormatArg>& args);

// Builds an error object. With log set and a format given, also writes one
// error-level line tagged with the function: "%d: %@", or "%d: %@ (%@)" when
// there is an underlying error.
template <typename... Args>
KSTErrorRef KSTCreateError(const char* function, int line, std::string_view domain,
                           std::int64_t code, KSTErrorRef underlying,
                           const PlistDictionary* userInfo, bool log, const char* format,
                           Args&&... args) {
  return KSTCreateErrorArgs(function, line, domain, code, std::move(underlying), userInfo, log,
                            format, std::vector<FormatArg>{FormatArg(std::forward<Args>(args))...});
}

KSTErrorRef KSTCreatePOSIXErrorArgs(const char* function, int line, int errnum, const char* format,
                                    const std::vector<FormatArg>& args);

// An error of the POSIX domain whose code is the errno value. Writes no log line.
template <typename... Args>
KSTErrorRef KSTCreatePOSIXError(const char* function, int line, int errnum, const char* format,
                                Args&&... args) {
  return KSTCreatePOSIXErrorArgs(function, line, errnum, format,
                                 std::vector<FormatArg>{FormatArg(std::forward<Args>(args))...});
}

// Stores the error's code into the caller's code, when the caller gave one:
// the 32-bit signed code widened with its sign to 64 bits.
void KSTHandOverCode(const KSTErrorRef& error, std::uint64_t* code);

// Stores a code directly (an operation that failed without an error object).
inline void KSTSetCode(std::uint64_t* code, std::uint64_t value) {
  if (code != nullptr) *code = value;
}

// Stores an error into an optional error out-parameter.
inline void KSTSetError(KSTErrorRef* out, KSTErrorRef error) {
  if (out != nullptr) *out = std::move(error);
}

}  // namespace kestrel

// KST_ERROR(code, underlying, log, format, args...) in domain KSTErrorDomain.
#define KST_ERROR(code, underlying, log, format, ...)                                             \
  ::kestrel::KSTCreateError(__func__, __LINE__, ::kestrel::kKSTErrorDomain, (code), (underlying), \
                            nullptr, (log), (format)__VA_OPT__(, ) __VA_ARGS__)
// KST_ERROR_IN(function, code, underlying, log, format, args...): the same, built by a
// helper on behalf of the operation named `function`, whose name the error and its
// log line carry.
#define KST_ERROR_IN(function, code, underlying, log, format, ...)                    \
  ::kestrel::KSTCreateError((function), __LINE__, ::kestrel::kKSTErrorDomain, (code), \
                            (underlying), nullptr, (log), (format)__VA_OPT__(, ) __VA_ARGS__)
// KST_POSIX_ERROR_IN(function, errnum, format, args...): likewise for the POSIX domain.
#define KST_POSIX_ERROR_IN(function, errnum, format, ...) \
  ::kestrel::KSTCreatePOSIXError((function), __LINE__, (errnum), (format)__VA_OPT__(, ) __VA_ARGS__)
#define KST_POSIX_ERROR(errnum, format, ...) \
  ::kestrel::KSTCreatePOSIXError(__func__, __LINE__, (errnum), (format)__VA_OPT__(, ) __VA_ARGS__)
