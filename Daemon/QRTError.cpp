#include "Daemon/QRTError.h"

#include <cxxabi.h>
#include <execinfo.h>
#include <pthread.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <typeinfo>

#include "platform/DeviceProperties.h"
#include "platform/Log.h"

std::optional<std::string> QRTError::localizedDescription() const {
  if (const plist::Value* v = plist::find(userInfo_, QRTLocalizedDescriptionKey)) {
    if (const std::string* s = v->stringIf()) return *s;
  }
  return std::nullopt;
}

std::string QRTError::description() const {
  std::string text = domain_ + " " + std::to_string(code_);
  if (auto d = localizedDescription()) text += ": " + *d;
  return text;
}

QRTErrorRef QRTCreateErrorArgs(const char* function, int line, const std::string& domain, int32_t code,
                               QRTErrorRef underlying, const plist::Dictionary* userInfo, bool log, const char* format,
                               std::initializer_list<QRTFormatArg> args) {
  plist::Dictionary info = userInfo ? *userInfo : plist::Dictionary{};
  if (format) {
    std::string text = QRTFormatArgs(format, args);
    if (log && platform::logEnabled(platform::kLogError)) {
      if (underlying) {
        platform::logWrite(platform::kLogError, function, QRTFormat("%d: %@ (%@)", line, text, underlying));
      } else {
        platform::logWrite(platform::kLogError, function, QRTFormat("%d: %@", line, text));
      }
    }
    info[QRTLocalizedDescriptionKey] = std::move(text);
  }
  info["FunctionName"] = std::string(function ? function : "");
  info["SourceFileLine"] = line;
  return std::make_shared<const QRTError>(domain, code, std::move(info), std::move(underlying));
}

namespace {

std::mutex gCrashReportLock;

std::string exceptionName(const std::exception& e) {
  // The dynamic type is the closest thing C++ has to an exception's name.
  int status = 0;
  char* demangled = abi::__cxa_demangle(typeid(e).name(), nullptr, nullptr, &status);
  std::string name = status == 0 && demangled ? demangled : typeid(e).name();
  free(demangled);
  return name;
}

}  // namespace

void QRTReportUncaughtException(const std::string& name, const std::string& reason) {
  std::string text = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
  char threadName[64] = {0};
  if (pthread_getname_np(pthread_self(), threadName, sizeof threadName) == 0 && threadName[0]) {
    text += "<" + std::string(threadName) + "> ";
  }
  if (!name.empty()) text += name + ": ";
  text += reason;
  text += "\nStack:\n";
  void* frames[64];
  int count = backtrace(frames, 64);
  if (char** symbols = backtrace_symbols(frames, count)) {
    for (int i = 0; i < count; ++i) {
      text += symbols[i];
      if (i + 1 < count) text += "\n";
    }
    free(symbols);
  }
  std::lock_guard<std::mutex> hold(gCrashReportLock);
  platform::logWrite(platform::kLogError, __func__, text);
  fprintf(stderr, "%s\n", text.c_str());
  fflush(stderr);
  abort();
}

void QRTReportUncaughtException(const std::exception& e) { QRTReportUncaughtException(exceptionName(e), e.what()); }

QRTErrorRef QRTErrorForCurrentException(const char* function, int line) {
  std::string name = "unknown", reason = "non-standard exception";
  try {
    throw;
  } catch (const std::exception& e) {
    name = exceptionName(e);
    reason = e.what();
  } catch (...) {}
  QRTErrorRef error = QRTCreateError(function, line, QRTErrorDomain, QRTErrorException, nullptr, nullptr, true,
                                     "Got exception: %@ : %@", name, reason);
  if (platform::deviceIsInternalBuild()) QRTReportUncaughtException(name, reason);
  return error;
}

QRTErrorRef QRTGuardedCall(const char* function, int line, const std::function<void()>& body) {
  try {
    body();
    return nullptr;
  } catch (...) { return QRTErrorForCurrentException(function, line); }
}
