#include "daemon/exceptions.h"

#include <cxxabi.h>

#include <mutex>
#include <typeinfo>

#include "daemon/errors.h"
#include "daemon/log.h"
#include "platform/process.h"
#include "platform/services.h"

namespace kestrel {

KSTException::KSTException(std::string name, std::string reason)
    : name_(std::move(name)),
      reason_(std::move(reason)),
      callStackSymbols_(platform::currentCallStackSymbols()) {}

namespace {

std::string demangle(const char* mangled) {
  int status = 0;
  std::unique_ptr<char, void (*)(void*)> text(abi::__cxa_demangle(mangled, nullptr, nullptr, &status),
                                               std::free);
  return status == 0 && text ? std::string(text.get()) : std::string(mangled);
}

std::string currentExceptionTypeName() {
  const std::type_info* type = abi::__cxa_current_exception_type();
  return type != nullptr ? demangle(type->name()) : std::string();
}

}  // namespace

CaughtException describeCurrentException() {
  CaughtException caught;
  try {
    throw;
  } catch (const KSTException& e) {
    caught.name = e.name();
    caught.reason = e.reason();
    caught.callStackSymbols = e.callStackSymbols();
    return caught;
  } catch (const std::exception& e) {
    caught.name = currentExceptionTypeName();
    caught.reason = e.what();
  } catch (...) {
    caught.name = currentExceptionTypeName();
  }
  // Exceptions that are not ours carry no stack: take the stack of the catch clause.
  caught.callStackSymbols = platform::currentCallStackSymbols();
  return caught;
}

std::string KSTExceptionReportText(const CaughtException& exception, const std::string& threadName) {
  std::string text = "** INTERNAL ERROR: Uncaught Exception **\n";
  text += "Exception: ";
  if (!threadName.empty()) text += "<" + threadName + "> ";
  if (!exception.name.empty()) text += exception.name + ": ";
  text += exception.reason;
  text += "\nStack:\n";
  for (size_t i = 0; i < exception.callStackSymbols.size(); ++i) {
    if (i > 0) text += "\n";
    text += exception.callStackSymbols[i];
  }
  return text;
}

void KSTReportException(const CaughtException& exception) {
  const std::string text = KSTExceptionReportText(exception, platform::currentThreadName());
  // Never released: the process ends here, and a second failing thread waits
  // so that one report is written whole.
  static std::mutex reportMutex;
  reportMutex.lock();
  KSTLogTag(kLogError, "KSTReportException", "%s", text);
  Log::flush();
  platform::abortWithCrashMessage(text);
}

void KSTHandleCaughtException(const char* function, int line, const CaughtException& exception,
                              std::uint64_t* code) {
  PlistArray symbols;
  symbols.reserve(exception.callStackSymbols.size());
  for (const std::string& symbol : exception.callStackSymbols) symbols.emplace_back(symbol);
  KSTErrorRef error = KSTCreateError(function, line, kKSTErrorDomain, kKSTErrorException, nullptr,
                                     nullptr, true, "Got exception: %@ : %@",
                                     exception.description(), PlistValue(std::move(symbols)));
  const auto& device = platform::services().deviceInfo;
  if (device && device->isInternalBuild()) KSTReportException(exception);
  KSTHandOverCode(error, code);
}

}  // namespace kestrel
