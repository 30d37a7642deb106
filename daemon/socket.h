// Server side of the local Unix-domain stream sockets.
#ifndef TARN_SOCKET_H
#define TARN_SOCKET_H

// Binds a listening stream socket at `path` (a file left there by an earlier
// run is unlinked first; paths longer than 107 characters are cut). Returns
// the descriptor (blocking mode) or -1.
int SocketListen(const char *path, int backlog);

// Accepts a pending connection on the listening descriptor `fd` without
// waiting. Returns the connection, or -1 at once when none is pending.
int SocketAcceptPoll(int fd);

// Waits at most timeoutUs for fd to become readable (or writable). A signal
// that interrupts select (SIGTERM arriving while a client is being served)
// does not end the wait early: it goes on for the time that is left, so that
// a request in flight is still answered. 1 ready, 0 not ready or error.
int SocketWaitReady(int fd, bool forWrite, long long timeoutUs);

#endif
