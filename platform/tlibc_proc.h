// Process utilities of the platform library: pid files, liveness checks,
// signalling by pid file or by program name, and starting programs.
#ifndef TLIBC_PROC_H
#define TLIBC_PROC_H

#include <sys/types.h>

// Reads the decimal pid stored in `path`. Returns the pid, 0 when the file
// holds no number, -1 when the file cannot be read (absent).
int TLIBCReadPidFile(const char *path);

// 1 when `pid` names a living process, 0 otherwise. A zombie (a process that
// has ended but was not yet reaped) counts as dead.
int TLIBCProcAlive(pid_t pid);

// Writes the calling process's pid ("%d\n") into `path`, replacing what was
// there. 0 on success, -1 on failure.
int TLIBCProcPidFileCreate(const char *path);

// 1 when the pid stored in `path` names a living process, 0 otherwise.
int TLIBCProcAliveByPidFile(const char *path);

// Sends `sig` to the living process whose pid is stored in `path`.
// 0 when sent, -1 when the file holds no living pid or kill() fails.
int TLIBCProcSignalByPidFile(const char *path, int sig);

// Ends every process whose program name (argv[0] without its directory, or
// the kernel's command name) is `name`. `sig` > 0 sends that signal only;
// `sig` 0 sends SIGTERM, waits up to 0.5 s and then sends SIGKILL to the
// ones still alive. When TARN_ROOT is set only processes whose executable
// lies under that root are touched, so that side-by-side installations never
// end each other's programs. The calling process is never signalled.
// Returns the number of processes signalled, or -1 when /proc cannot be read.
int TLIBCKill(const char *name, int sig);

// Starts the program `path` with the argument vector `argv` (null-terminated,
// argv[0] included) and the caller's environment. The new process gets no
// descriptors of the caller beyond 0, 1 and 2 and is detached from the caller
// (it is not the caller's child, so it never lingers as the caller's zombie).
// `noWait` non-zero: returns 0 once the program has been executed, -1 when it
// could not be started. `noWait` 0: runs the program as a direct child, waits
// for it and returns its exit status (-1 when it could not be run or was
// killed by a signal).
int TLIBCExecv(const char *path, char *const argv[], int noWait = 1);

#endif
