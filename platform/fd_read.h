// Reading a stream socket or pipe to its end, with a time limit.
#ifndef TARN_FD_READ_H
#define TARN_FD_READ_H

#include <cstddef>
#include <string>

// Appends what comes on fd to *data until the peer closes it, an error, or
// timeoutMs pass (interrupted waits go on), or, with atMost > 0, once *data
// holds atMost bytes; returns the size of *data.
size_t TarnReadUntilClosed(int fd, int timeoutMs, std::string *data, size_t atMost = 0);

#endif
