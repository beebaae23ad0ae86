#include "base/VSACrash.h"

#include <cxxabi.h>
#include <execinfo.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <exception>
#include <mutex>
#include <typeinfo>

#include "base/VSALog.h"
#include "base/VSAWorkQueue.h"

namespace {
std::mutex gCrashMessageLock;
char gCrashMessage[8192];

std::string currentStack() {
  void* frames[64];
  int n = backtrace(frames, 64);
  char** symbols = backtrace_symbols(frames, n);
  std::string out;
  for (int i = 0; i < n; ++i) {
    out += symbols ? symbols[i] : "?";
    out += "\n";
  }
  free(symbols);
  return out;
}

std::string demangle(const char* name) {
  int status = 0;
  char* d = abi::__cxa_demangle(name, nullptr, nullptr, &status);
  std::string out = (status == 0 && d) ? d : name;
  free(d);
  return out;
}

void terminateHandler() {
  std::string name, reason;
  if (auto ex = std::current_exception()) {
    try {
      std::rethrow_exception(ex);
    } catch (const std::exception& e) {
      name = demangle(typeid(e).name());
      reason = e.what();
    } catch (...) {
      if (auto* t = abi::__cxa_current_exception_type()) name = demangle(t->name());
    }
  }
  VSACrash(VSAUncaughtExceptionText(VSAWorkQueue::currentLabel(), name, reason, currentStack()));
}
}  // namespace

void VSAInstallUncaughtExceptionHandler() { std::set_terminate(terminateHandler); }

std::string VSAUncaughtExceptionText(const std::string& threadName, const std::string& name,
                                     const std::string& reason, const std::string& stack) {
  std::string text = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
  if (!threadName.empty()) text += "<" + threadName + "> ";
  if (!name.empty()) text += name + ": ";
  text += reason;
  text += "\nStack:\n";
  text += stack;
  return text;
}

const char* VSACrashMessage() { return gCrashMessage; }

void VSACrash(const std::string& message) {
  {
    std::lock_guard lock(gCrashMessageLock);
    size_t n = std::min(message.size(), sizeof gCrashMessage - 1);
    std::memcpy(gCrashMessage, message.data(), n);
    gCrashMessage[n] = '\0';
  }
  VSALog(kVSALogFault, "VSACrash", "%s", message);
  VSALogger::shared().flush();
  (void)!::write(STDERR_FILENO, gCrashMessage, std::strlen(gCrashMessage));
  (void)!::write(STDERR_FILENO, "\n", 1);
  std::abort();
}
