// Fuzz target: one control connection served by the daemon's real request
// handler, with a real LocalPlayer and its queue.
//
// The input is what a client writes on its connection. Inputs of up to 8196
// bytes are padded with zeros to a whole request (so short inputs still
// reach the dispatch); longer inputs are written as they are (an over-long
// request). The handler gets the other end of a socketpair, exactly as the
// main loop hands it an accepted connection. Checked after each request:
// a whole request gets exactly one 8192-byte reply holding a NUL-terminated
// text, and the connection is closed.
//
// Neutralised: the source changes that replace the queue with a whole
// source (codes 1, 2, 3, 31 to 34) scan the media library, fetch radio
// directories and run a shell; they are answered by the same handler in the
// process tests instead. Play requests reach the player, which finds no
// mplayer-daemon under the private root and fails to start it.
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "daemon/globals.h"
#include "daemon/tarn_types.h"
#include "daemon/tarnaudiod.h"
#include "fuzz/fuzz_root.h"
#include "player/localplayer.h"
#include "player/playlist.h"
#include "upnp/upnp.h"

namespace {

LocalPlayer *g_player = nullptr;
UpnpController *g_controller = nullptr;
std::vector<UpnpPlayer *> g_upnpPlayers;

bool IsSourceChange(int32_t action)
{
    switch (action) {
    case ACT_SOURCE_RANDOM:
    case ACT_SOURCE_RADIO:
    case ACT_SOURCE_IPOD:
    case ACT_SOURCE_PLAYLIST:
    case ACT_SOURCE_CUSTOM:
    case ACT_SOURCE_NEXT:
    case ACT_SOURCE_PREVIOUS:
        return true;
    default:
        return false;
    }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    FuzzMakeRoot();
    g_player = new LocalPlayer();
    g_controller = new UpnpController();  // never initialised: no network use
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size > 2 * CTRL_REQUEST_SIZE)
        return 0;
    std::vector<uint8_t> bytes(data, data + size);
    if (bytes.size() < CTRL_REQUEST_SIZE)
        bytes.resize(CTRL_REQUEST_SIZE, 0);
    int32_t action;
    memcpy(&action, bytes.data(), sizeof(action));
    if (IsSourceChange(action))
        return 0;

    // The selection is process-wide; every input starts from the local
    // player, as the daemon does after start.
    g_localSelected = 1;
    g_selectedRenderer = -1;
    // Keep the queue bounded over millions of inputs.
    if (g_player->GetPlaylist()->Count() > 2000)
        g_player->GetPlaylist()->Clear();

    int sv[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0)
        abort();
    // Room for the whole request and the reply without blocking.
    int buf = 64 * 1024;
    setsockopt(sv[0], SOL_SOCKET, SO_SNDBUF, &buf, sizeof(buf));
    setsockopt(sv[0], SOL_SOCKET, SO_RCVBUF, &buf, sizeof(buf));
    setsockopt(sv[1], SOL_SOCKET, SO_SNDBUF, &buf, sizeof(buf));
    setsockopt(sv[1], SOL_SOCKET, SO_RCVBUF, &buf, sizeof(buf));
    ssize_t w = write(sv[0], bytes.data(), bytes.size());
    if (w != static_cast<ssize_t>(bytes.size()))
        abort();

    HandleRequest(sv[1], g_player, g_controller, g_upnpPlayers);

    // The handler closed its end: read until end of file.
    std::vector<char> reply;
    char chunk[4096];
    for (;;) {
        ssize_t n = read(sv[0], chunk, sizeof(chunk));
        if (n <= 0)
            break;
        reply.insert(reply.end(), chunk, chunk + n);
    }
    close(sv[0]);

    // The handler reads exactly one request per connection; anything longer
    // is still answered (the rest is never read).
    if (reply.size() != CTRL_REPLY_SIZE) {
        fprintf(stderr, "control_request: action %d, %zu input bytes: reply of %zu bytes\n",
                action, size, reply.size());
        abort();
    }
    if (memchr(reply.data(), '\0', reply.size()) == nullptr) {
        fprintf(stderr, "control_request: reply without NUL\n");
        abort();
    }
    return 0;
}
