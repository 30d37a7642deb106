// The harness's control-socket side: starting the daemon (ready once it
// answers), raw requests and queue additions. Built into tarn_testharness
// with the control-socket client; the rest of the harness needs neither.
#include "platform/fd_read.h"
#include "tests/harness/harness.h"

#include <cerrno>
#include <cstring>
#include <unistd.h>

#include "daemon/ctrl.h"
#include "platform/tarn_clock.h"
#include "platform/tlibc_proc.h"

namespace tarntest {

int Harness::Start(int timeoutMs)
{
    if (!error.empty() && error.find("TARN_ROOT") != std::string::npos)
        return -1;
    if (daemonPid > 0)
        return error = "daemon already started by this harness", -1;
    int64_t end = TarnNowMs() + timeoutMs;
    std::string out;
    int rc = Launch(&out, timeoutMs);
    if (rc != 0) {
        error = "tarnaudiod exited with " + std::to_string(rc) + ": " + out + " " + error;
        return -1;
    }
    for (;;) {
        int pid = PidFromFile();
        // Ready once it answers: the socket exists before the loop runs.
        if (pid > 0 && TLIBCProcAlive(pid) && Exists(TARN_CTRL_SOCKET) &&
            Request(ACT_GET_STATUS, nullptr, nullptr, static_cast<int>(end - TarnNowMs())) == 0) {
            daemonPid = pid;
            error.clear();
            return 0;
        }
        Reap();
        if (TarnNowMs() >= end) {
            error = "tarnaudiod did not become ready (pid file " + std::to_string(pid) +
                    "); log:\n" + Log();
            return -1;
        }
        usleep(5000);
    }
}

// ---- control requests --------------------------------------------------------

int Harness::Connect() const
{
    int fd = CtrlConnectAt(Path(TARN_CTRL_SOCKET).c_str(), false, nullptr);
    return fd < 0 ? -1 : fd;
}

int Harness::SendBytes(const void *bytes, size_t length, std::string *reply, int timeoutMs,
                       size_t *received)
{
    if (received)
        *received = 0;
    if (reply)
        reply->clear();
    int fd = Connect();
    if (fd < 0) {
        error = "cannot connect to " + Path(TARN_CTRL_SOCKET) + ": " + strerror(errno);
        return -1;
    }
    if (length > 0 && write(fd, bytes, length) != static_cast<ssize_t>(length)) {
        error = std::string("write failed: ") + strerror(errno);
        close(fd);
        return -1;
    }
    std::string data;
    TarnReadUntilClosed(fd, timeoutMs, &data);
    close(fd);
    if (received)
        *received = data.size();
    if (data.empty()) {
        error = "no reply";
        return -1;
    }
    if (reply)
        *reply = std::string(data.c_str());
    return 0;
}

int Harness::QueueInsert(const TARN_MEDIA_INFO &info, int position)
{
    ControlRequest req = MakeRequest(position < 0 ? ACT_QUEUE_ADD : ACT_QUEUE_INSERT);
    memcpy(req.parameter, &info, sizeof(info));
    int32_t pos = position < 0 ? 0 : position;
    memcpy(reinterpret_cast<char *>(&req) + CTRL_INSERT_POS_OFFSET, &pos, sizeof(pos));
    return RequestRaw(req, nullptr);
}

}  // namespace tarntest
