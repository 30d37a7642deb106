#include "daemon/ctrl.h"

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "daemon/socket.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"

static const char kCtrlUnit[] = "ctrl";
static const char kInfoUnit[] = "info";

namespace {

// A request with the action and, when format is given, the parameter text.
void Fill(ControlRequest *request, int action)
{
    memset(request, 0, sizeof(*request));
    request->action = action;
}

// Sends a request whose reply is not wanted.
int SendSimple(ControlRequest *request)
{
    char reply[CTRL_REPLY_SIZE];
    return CtrlSendRequest(request, reply, sizeof(reply));
}

int SendAction(int action)
{
    ControlRequest request;
    Fill(&request, action);
    return SendSimple(&request);
}

int SendInt(int action, int value)
{
    ControlRequest request;
    Fill(&request, action);
    snprintf(request.parameter, CTRL_PARAM_SIZE, "%d", value);
    return SendSimple(&request);
}

int SendPage(int action, int start, int limit, char *reply, int replySize)
{
    ControlRequest request;
    Fill(&request, action);
    snprintf(request.parameter, CTRL_PARAM_SIZE, "%d %d", start, limit);
    return CtrlSendRequest(&request, reply, replySize);
}

}  // namespace

int CtrlConnect()
{
    return CtrlConnectWhy(nullptr);
}

int CtrlConnectAt(const char *path, bool nonBlocking, int *error)
{
    if (error)
        *error = 0;
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | (nonBlocking ? SOCK_NONBLOCK : 0), 0);
    if (fd < 0) {
        if (error)
            *error = errno;
        return -1;
    }
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path);
    if (connect(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) == -1) {
        int err = errno;
        close(fd);
        errno = err;
        if (error)
            *error = err;
        return -2;
    }
    if (nonBlocking)
        fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) & ~O_NONBLOCK);
    return fd;
}

int CtrlConnectWhy(int *error)
{
    std::string path = TarnPath(TARN_CTRL_SOCKET);
    int fd = CtrlConnectAt(path.c_str(), false, error);
    if (fd == -2) {
        TarnLog("%s:%d Failed to connect to %s. [%m]", kCtrlUnit, 27, path.c_str());
        return -1;
    }
    return fd;
}

int CtrlSendRequest(const ControlRequest *request, char *reply, int replySize)
{
    return CtrlSendRequestTimed(request, reply, replySize, 500, nullptr);
}

int CtrlSendRequestTimed(const ControlRequest *request, char *reply, int replySize, int timeoutMs,
                         int *error)
{
    int unused = 0;
    if (!error)
        error = &unused;
    *error = 0;
    if (!reply || replySize <= 0 || !request) {
        TarnLog("%s:%d Bad parameter", kCtrlUnit, 45);
        *error = EINVAL;
        return -1;
    }
    int fd = CtrlConnectWhy(error);
    if (fd < 0)
        return -1;
    ssize_t written = write(fd, request, CTRL_REQUEST_SIZE);
    if (written != CTRL_REQUEST_SIZE) {
        *error = written < 0 ? errno : EPIPE;
        TarnLog("%s:%d Failed to send command.", kCtrlUnit, 55);
        close(fd);
        return -1;
    }
    if (!SocketWaitReady(fd, false, static_cast<long long>(timeoutMs) * 1000)) {
        *error = ETIMEDOUT;
        if (fd > 0)
            close(fd);
        return -1;
    }
    memset(reply, 0, static_cast<size_t>(replySize));
    ssize_t n = read(fd, reply, static_cast<size_t>(replySize));
    int result = 0;
    if (n < 1) {
        *error = n < 0 ? errno : EPIPE;
        TarnLog("%s:%d Failed to read action [%m]", kCtrlUnit, 73);
        result = -1;
    }
    // Descriptor 0 is deliberately left open.
    if (fd > 0)
        close(fd);
    return result;
}

int CtrlPlayPause() { return SendAction(ACT_PLAY_PAUSE); }
int CtrlStop() { return SendAction(ACT_STOP); }
int CtrlNext() { return SendAction(ACT_NEXT); }
int CtrlPrevious() { return SendAction(ACT_PREVIOUS); }
int CtrlPlayIndex(int index) { return SendInt(ACT_PLAY_INDEX, index); }
int CtrlSeek(int position) { return SendInt(ACT_SEEK, position); }
int CtrlMute() { return SendAction(ACT_MUTE); }
int CtrlSetVolume(int volume) { return SendInt(ACT_SET_VOLUME, volume); }
int CtrlVolumeUp() { return SendAction(ACT_VOLUME_UP); }
int CtrlVolumeDown() { return SendAction(ACT_VOLUME_DOWN); }

int CtrlSourceRandom() { return SendAction(ACT_SOURCE_RANDOM); }
int CtrlSourceRadio() { return SendAction(ACT_SOURCE_RADIO); }
int CtrlSourceIpod() { return SendAction(ACT_SOURCE_IPOD); }
int CtrlSourcePlaylist() { return SendAction(ACT_SOURCE_PLAYLIST); }
int CtrlSourceCustom(int slot) { return SendInt(ACT_SOURCE_CUSTOM, slot); }
int CtrlSaveCustom(int slot) { return SendInt(ACT_SAVE_CUSTOM, slot); }
int CtrlSourceNext() { return SendAction(ACT_SOURCE_NEXT); }
int CtrlSourcePrevious() { return SendAction(ACT_SOURCE_PREVIOUS); }

int CtrlClearChanged() { return SendAction(ACT_CLEAR_CHANGED); }
int CtrlSetChanged() { return SendAction(ACT_SET_CHANGED); }

int CtrlFormatEqualizer(const float gains[10], char *text, int size)
{
    if (!text || size <= 0)
        return -1;
    text[0] = '\0';
    int offset = 0;
    for (int i = 0; i < 10 && offset < size - 1; ++i) {
        int n = snprintf(text + offset, static_cast<size_t>(size - offset), "%s%3.1f",
                         i ? " " : "", static_cast<double>(gains[i]));
        if (n < 0)
            break;
        offset += n;
        if (offset >= size)
            offset = size - 1;
    }
    return offset;
}

int CtrlSetEqualizer(const float gains[10])
{
    if (!gains) {
        TarnLog("%s:%d Bad parameter", kCtrlUnit, 45);
        return -1;
    }
    ControlRequest request;
    Fill(&request, ACT_SET_EQUALIZER);
    CtrlFormatEqualizer(gains, request.parameter, CTRL_PARAM_SIZE);
    return SendSimple(&request);
}

int InfoSearchServers() { return SendAction(ACT_SEARCH_SERVERS); }
int InfoSearchRenderers() { return SendAction(ACT_SEARCH_RENDERERS); }

int InfoListServers(int start, int limit, char *reply, int replySize)
{
    if (!reply || replySize <= 0) {
        TarnLog("%s:%d Bad parameters", kInfoUnit, 62);
        return -1;
    }
    return SendPage(ACT_LIST_SERVERS, start, limit, reply, replySize);
}

int InfoListRenderers(int start, int limit, char *reply, int replySize)
{
    if (!reply || replySize <= 0) {
        TarnLog("%s:%d Bad parameters", kInfoUnit, 88);
        return -1;
    }
    return SendPage(ACT_LIST_RENDERERS, start, limit, reply, replySize);
}

int InfoSelectPlayer(int index) { return SendInt(ACT_SELECT_PLAYER, index); }

int InfoGetStatus(char *reply, int replySize)
{
    if (!reply || replySize <= 0) {
        TarnLog("%s:%d Bad parameters", kInfoUnit, 135);
        return -1;
    }
    ControlRequest request;
    Fill(&request, ACT_GET_STATUS);
    return CtrlSendRequest(&request, reply, replySize);
}

int InfoListQueue(int start, int limit, char *reply, int replySize)
{
    if (!reply || replySize <= 0) {
        TarnLog("%s:%d Bad parameters", kInfoUnit, 160);
        return -1;
    }
    return SendPage(ACT_QUEUE_LIST, start, limit, reply, replySize);
}
