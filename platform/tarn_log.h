// Logging: every message goes to syslog at LOG_ERR and, when TARN_LOG_FILE
// is set, is appended to that file as one line of formatted text.
//
// Messages begin with "%s:%d " filled with the unit name and a line number:
//   TarnLog("%s:%d Failed to bind socket.", "socket", 31);
// or, where the source line is the number to log:
//   TLOG("Failed to new TARN_MEDIA_INFO");   // uses kLogUnit of the file
// "%m" is replaced by the text of errno as it was at the call.
#ifndef TARN_LOG_H
#define TARN_LOG_H

#include <cstdarg>

void TarnLog(const char *fmt, ...) __attribute__((format(printf, 1, 2)));
void TarnLogV(const char *fmt, va_list ap);

// Opens syslog with the program's identity (call once at start-up).
void TarnLogOpen(const char *ident);

// On: every message is also written to standard error as "ident: text"
// (programs running attached, e.g. under a service manager).
void TarnLogToStderr(bool on);

// Each source file that uses TLOG defines: static const char kLogUnit[] = "unit";
#define TLOG(fmt, ...) TarnLog("%s:%d " fmt, kLogUnit, __LINE__, ##__VA_ARGS__)

#endif
