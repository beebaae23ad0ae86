// Ending the process on unrecoverable conditions, with a message kept for
// the crash report.
//
// VSACrash stores the message as the crash message (a process-wide buffer
// that a core dump or crash reporter can read), writes it to the logs and
// aborts. The uncaught-exception handler builds the daemon's fixed text
// ("** INTERNAL ERROR: Uncaught Exception **" ...) from the exception, the
// current queue's name and the call stack, and crashes with it.
#pragma once

#include <string>

// Installs the process's uncaught-exception handler (std::terminate).
void VSAInstallUncaughtExceptionHandler();

// The text recorded for an uncaught exception; empty parts are left out.
std::string VSAUncaughtExceptionText(const std::string& threadName, const std::string& name,
                                     const std::string& reason, const std::string& stack);

// The message stored by the last VSACrash (for tests of the text).
const char* VSACrashMessage();

[[noreturn]] void VSACrash(const std::string& message);
