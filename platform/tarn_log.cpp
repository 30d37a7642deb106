#include "tarn_log.h"
#include "tarn_env.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <syslog.h>
#include <unistd.h>

namespace {
bool g_toStderr = false;
const char *g_ident = "";
}  // namespace

void TarnLogOpen(const char *ident)
{
    g_ident = ident;
    openlog(ident, LOG_PID, LOG_DAEMON);
}

void TarnLogToStderr(bool on)
{
    g_toStderr = on;
}

void TarnLogV(const char *fmt, va_list ap)
{
    int savedErrno = errno;
    // Expand %m ourselves so that syslog and the log file get the same text.
    std::string f;
    for (const char *p = fmt; *p; ++p) {
        if (p[0] == '%' && p[1] == '%') {
            f += "%%";
            ++p;
        } else if (p[0] == '%' && p[1] == 'm') {
            for (const char *e = strerror(savedErrno); *e; ++e) {
                if (*e == '%')
                    f += '%';
                f += *e;
            }
            ++p;
        } else {
            f += *p;
        }
    }
    char buf[8192];
    va_list copy;
    va_copy(copy, ap);
    vsnprintf(buf, sizeof(buf), f.c_str(), copy);
    va_end(copy);
    syslog(LOG_ERR, "%s", buf);
    if (g_toStderr) {
        std::string line = std::string(g_ident) + ": " + buf + "\n";
        ssize_t w = write(STDERR_FILENO, line.data(), line.size());
        (void)w;
    }
    const std::string &file = TarnLogFile();
    if (!file.empty()) {
        int fd = open(file.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
        if (fd >= 0) {
            std::string line(buf);
            line += '\n';
            ssize_t w = write(fd, line.data(), line.size());
            (void)w;
            close(fd);
        }
    }
    errno = savedErrno;
}

void TarnLog(const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    TarnLogV(fmt, ap);
    va_end(ap);
}
