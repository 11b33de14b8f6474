// Exceptions never cross a request. The body of every long operation runs
// inside KST_CATCH_EXCEPTIONS: an exception caught there becomes error 40
// ("Got exception: %@ : %@", logged), and on an internal build the daemon then
// writes a report and stops (KSTReportException).
//
//   return KST_CATCH_EXCEPTIONS(error, false, [&] { ...; return true; });
#pragma once

#include <cstdint>
#include <exception>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

namespace kestrel {

// An exception of the daemon's own: a name, a reason and the call stack at the
// point where it was made.
class KSTException : public std::exception {
 public:
  KSTException(std::string name, std::string reason);
  const char* what() const noexcept override { return reason_.c_str(); }
  const std::string& name() const { return name_; }
  const std::string& reason() const { return reason_; }
  const std::vector<std::string>& callStackSymbols() const { return callStackSymbols_; }

 private:
  std::string name_;
  std::string reason_;
  std::vector<std::string> callStackSymbols_;
};

// What the catch clause learned about a caught exception.
struct CaughtException {
  std::string name;
  std::string reason;
  std::vector<std::string> callStackSymbols;
  std::string description() const { return reason.empty() ? name : reason; }
};

// Describes the exception that is being handled (call only inside a catch block).
CaughtException describeCurrentException();

// The report text: "** INTERNAL ERROR: Uncaught Exception **\nException: <thread> name: reason\nStack:\n...".
std::string KSTExceptionReportText(const CaughtException& exception, const std::string& threadName);

// Writes the report to the log at error level and aborts the process.
[[noreturn]] void KSTReportException(const CaughtException& exception);

// The shared catch-clause handling: builds and logs error 40, reports on an
// internal build, otherwise stores 40 into the code.
void KSTHandleCaughtException(const char* function, int line, const CaughtException& exception,
                              std::uint64_t* code);

template <typename Fallback, typename Body>
std::invoke_result_t<Body> KSTRunCatchingExceptions(const char* function, int line,
                                                    std::uint64_t* code, Fallback&& fallback,
                                                    Body&& body) noexcept {
  using Result = std::invoke_result_t<Body>;
  try {
    return std::forward<Body>(body)();
  } catch (...) {
    KSTHandleCaughtException(function, line, describeCurrentException(), code);
  }
  return Result(std::forward<Fallback>(fallback));
}

template <typename Body>
void KSTRunCatchingExceptions(const char* function, int line, std::uint64_t* code,
                              Body&& body) noexcept {
  try {
    std::forward<Body>(body)();
  } catch (...) {
    KSTHandleCaughtException(function, line, describeCurrentException(), code);
  }
}

}  // namespace kestrel

// KST_CATCH_EXCEPTIONS(code, body) for a body returning nothing;
// KST_CATCH_EXCEPTIONS(code, fallback, body) for a body returning a value.
#define KST_CATCH_EXCEPTIONS(code, ...) \
  ::kestrel::KSTRunCatchingExceptions(__func__, __LINE__, (code), __VA_ARGS__)
