// Control requests: reading one, dispatching it to the daemon's own
// actions, the source changes or the selected player, and the reply text.
#include "daemon/tarnaudiod.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <unistd.h>

#include "daemon/globals.h"
#include "daemon/socket.h"
#include "platform/json_text.h"
#include "platform/tarn_log.h"
#include "player/localplayer.h"
#include "player/playlist_actions.h"
#include "player/upnpplayer.h"
#include "source/changesrc.h"
#include "upnp/upnp.h"
#include "wire/action_table.h"

static const char kLogUnit[] = "tarnaudiod";

UpnpPlayer *FindPlayerByIndex(std::vector<UpnpPlayer *> &players, int index)
{
    for (UpnpPlayer *p : players) {
        if (p->GetRendererIndex() == index)
            return p;
    }
    return nullptr;
}

namespace {

// How long the handler waits for a request and for the client to take the
// reply.
const long long kWaitUs = 500000;

int WaitFd(int fd, bool forWrite)
{
    return SocketWaitReady(fd, forWrite, kWaitUs);
}

// The request as read, followed by a NUL so that a parameter text without
// its own terminator still ends inside our buffer.
struct GuardedRequest {
    ControlRequest request;
    char terminator[4];
};

// One read of a whole request into a cleared buffer; 0, or -1 logged.
int ReadRequest(int fd, GuardedRequest *in)
{
    memset(in, 0, sizeof(*in));
    ssize_t n;
    do {
        n = read(fd, &in->request, CTRL_REQUEST_SIZE);
    } while (n == -1 && errno == EINTR);
    if (n != CTRL_REQUEST_SIZE) {
        TarnLog("%s:%d Failed to read action [%m]", kLogUnit, 311);
        return -1;
    }
    return 0;
}

UpnpPlayer *FindPlayerByUdn(std::vector<UpnpPlayer *> &players, const std::string &udn)
{
    for (UpnpPlayer *p : players) {
        if (p->GetUdn() == udn)
            return p;
    }
    return nullptr;
}

void SelectPlayer(const char *parameter, UpnpController *controller,
                  std::vector<UpnpPlayer *> &upnpPlayers)
{
    int index = static_cast<int>(strtol(parameter, nullptr, 10));
    if (index == -1) {
        g_selectedRenderer = -1;
        g_localSelected = 1;
        return;
    }
    if (index < -1) {
        TarnLog("%s:%d Bad player index [%d]", kLogUnit, 378, index);
        return;
    }
    // The renderer list changes on the UPnP library's threads: select and
    // read the renderer's record under the controller's lock.
    controller->Lock();
    int rc = controller->SelectRenderer(static_cast<unsigned>(index));
    RENDERER_INFO *r = nullptr;
    if (rc == 0 && controller->GetRenderer(static_cast<unsigned>(index), &r) == 0) {
        // A renderer that was here before finds its player and queue again.
        UpnpPlayer *player = FindPlayerByUdn(upnpPlayers, r->udn);
        if (!player)
            upnpPlayers.push_back(new UpnpPlayer(controller, index));
        else if (player->IsGone())
            player->OnRendererBack(index);
    }
    controller->Unlock();
    if (rc != 0)
        return;  // out of range; the controller logs
    g_selectedRenderer = index;
    g_localSelected = 0;
}

}  // namespace

// ---------------------------------------------------------------------------
// Control requests.

// The reply with as many whole entries of its array `key` (a queue page's
// "uris", a device list's "list") as fit CTRL_REPLY_SIZE - 1 characters:
// the largest such count, found by halving.
static std::string CutPage(const Json::Value &reply, const char *key)
{
    Json::Value page = reply;
    Json::Value &entries = page[key];
    const Json::Value all = entries;
    Json::ArrayIndex fits = 0;            // known to fit
    Json::ArrayIndex tooMany = all.size();  // known not to
    std::string text;
    while (tooMany - fits > 1) {
        Json::ArrayIndex n = fits + (tooMany - fits) / 2;
        entries = Json::Value(Json::arrayValue);
        for (Json::ArrayIndex i = 0; i < n; i++)
            entries.append(all[i]);
        if (JsonText(page).size() < CTRL_REPLY_SIZE)
            fits = n;
        else
            tooMany = n;
    }
    entries = Json::Value(Json::arrayValue);
    for (Json::ArrayIndex i = 0; i < fits; i++)
        entries.append(all[i]);
    return JsonText(page);
}

void FormatReply(const Json::Value &reply, char buffer[CTRL_REPLY_SIZE])
{
    std::string text = JsonText(reply);
    // A queue page or device list that does not fit is cut by whole entries
    // from its end, so that the reply stays valid JSON; "total" still tells
    // the whole length.
    for (const char *key : {"uris", "list"}) {
        if (text.size() >= CTRL_REPLY_SIZE && reply.isObject() && reply.isMember(key) &&
            reply[key].isArray() && reply[key].size() > 0)
            text = CutPage(reply, key);
    }
    memset(buffer, 0, CTRL_REPLY_SIZE);
    snprintf(buffer, CTRL_REPLY_SIZE, "%s", text.c_str());
}

namespace {

// What a daemon-level handler gets.
struct DispatchCall {
    const ControlRequest *request;
    Json::Value &reply;
    LocalPlayer *localPlayer;
    UpnpController *controller;
    std::vector<UpnpPlayer *> &upnpPlayers;
};

// A source change: 0 when the local queue was replaced.
typedef int (*SourceChange)(const char *parameter, LocalPlayer *player);
// Any other action the daemon itself takes.
typedef void (*DaemonHandler)(DispatchCall &call);

// One action code the daemon answers itself: either a source change or a
// handler.
struct DaemonAction {
    int action;
    SourceChange change;
    DaemonHandler handle;
};

int SourceRandom(const char *, LocalPlayer *player) { return ChangeSourceRandom100(player, true); }
int SourceRadio(const char *, LocalPlayer *player) { return ChangeSourceRadio(player); }
int SourceIPod(const char *, LocalPlayer *player) { return ChangeSourceIPod(player); }
int SourcePlaylist(const char *, LocalPlayer *player) { return ChangeSourceFirstPlaylist(player); }
int SourceNext(const char *, LocalPlayer *player) { return ChangeSourceNext(player); }
int SourcePrevious(const char *, LocalPlayer *player) { return ChangeSourcePrevious(player); }
int SourceCustom(const char *parameter, LocalPlayer *player)
{
    return ChangeSourceCustom(static_cast<int>(strtol(parameter, nullptr, 10)), player);
}

void SearchServers(DispatchCall &call) { call.controller->SearchServers(); }

void SearchRenderers(DispatchCall &call)
{
    call.controller->SearchQuick();
    call.controller->SearchRenderers();
}

void ListDevices(DispatchCall &call)
{
    int start = 0;
    int limit = 0;
    if (sscanf(call.request->parameter, "%d %d", &start, &limit) < 1)
        start = 0;
    call.controller->Lock();
    if (call.request->action == ACT_LIST_SERVERS)
        call.controller->GetServerList(call.reply, start, limit);
    else
        call.controller->GetRendererList(call.reply, start, limit);
    call.controller->Unlock();
}

void SelectPlayerAction(DispatchCall &call)
{
    SelectPlayer(call.request->parameter, call.controller, call.upnpPlayers);
}

void ClearChanged(DispatchCall &) { g_changed = 0; }
void SetChanged(DispatchCall &) { g_changed = 1; }

void SaveCustom(DispatchCall &call)
{
    SaveCustomSource(static_cast<int>(strtol(call.request->parameter, nullptr, 10)),
                     call.localPlayer);
}

const DaemonAction kDaemonActions[] = {
    {ACT_SOURCE_RANDOM, SourceRandom, nullptr},
    {ACT_SOURCE_RADIO, SourceRadio, nullptr},
    {ACT_SOURCE_IPOD, SourceIPod, nullptr},
    {ACT_SOURCE_PLAYLIST, SourcePlaylist, nullptr},
    {ACT_SOURCE_CUSTOM, SourceCustom, nullptr},
    {ACT_SOURCE_NEXT, SourceNext, nullptr},
    {ACT_SOURCE_PREVIOUS, SourcePrevious, nullptr},
    {ACT_SEARCH_SERVERS, nullptr, SearchServers},
    {ACT_SEARCH_RENDERERS, nullptr, SearchRenderers},
    {ACT_LIST_SERVERS, nullptr, ListDevices},
    {ACT_LIST_RENDERERS, nullptr, ListDevices},
    {ACT_SELECT_PLAYER, nullptr, SelectPlayerAction},
    {ACT_CLEAR_CHANGED, nullptr, ClearChanged},
    {ACT_SET_CHANGED, nullptr, SetChanged},
    {ACT_SAVE_CUSTOM, nullptr, SaveCustom},
};

}  // namespace

namespace {

// A request the daemon answers itself (a source change or one of its own
// actions) is carried out; false for any other.
bool DaemonTakes(const ControlRequest *request, Json::Value &reply, LocalPlayer *localPlayer,
                 UpnpController *controller, std::vector<UpnpPlayer *> &upnpPlayers)
{
    const DaemonAction *own = FindAction(kDaemonActions, request->action);
    if (!own)
        return false;
    if (own->change) {
        // A source change always returns playback to the local player,
        // before the change is even attempted.
        g_localSelected = 1;
        g_selectedRenderer = -1;
        if (own->change(request->parameter, localPlayer) == 0)
            g_changed = 1;
        return true;
    }
    DispatchCall call = {request, reply, localPlayer, controller, upnpPlayers};
    own->handle(call);
    return true;
}

// The player every other request goes to: the local player or the selected
// renderer's; neither when no renderer is selected, or when the selected
// one has no player (logged).
struct SelectedPlayer {
    LocalPlayer *local;
    UpnpPlayer *upnp;
};

SelectedPlayer FindSelected(LocalPlayer *localPlayer, std::vector<UpnpPlayer *> &upnpPlayers)
{
    if (g_localSelected)
        return {localPlayer, nullptr};
    if (g_selectedRenderer == -1)
        return {nullptr, nullptr};
    UpnpPlayer *player = FindPlayerByIndex(upnpPlayers, g_selectedRenderer);
    if (!player)
        TarnLog("%s:%d No upnp player index [%d]", kLogUnit, 395, g_selectedRenderer);
    return {nullptr, player};
}

}  // namespace

void AnswerRequest(const ControlRequest *request, char out[CTRL_REPLY_SIZE], LocalPlayer *localPlayer,
                   UpnpController *controller, std::vector<UpnpPlayer *> &upnpPlayers)
{
    Json::Value reply;  // null unless a handler fills it
    if (!DaemonTakes(request, reply, localPlayer, controller, upnpPlayers)) {
        SelectedPlayer selected = FindSelected(localPlayer, upnpPlayers);
        if (request->action == ACT_QUEUE_LIST && (selected.local || selected.upnp)) {
            // A renderer player's queue is read under the controller's lock.
            if (selected.upnp)
                controller->Lock();
            Playlist *queue = selected.local ? selected.local->GetPlaylist() : selected.upnp->GetPlaylist();
            PlaylistPageReply(*queue, request, out);
            if (selected.upnp)
                controller->Unlock();
            return;
        }
        if (selected.local)
            selected.local->HandleAction(request, reply);
        else if (selected.upnp)
            selected.upnp->HandleAction(request, reply);
    }
    FormatReply(reply, out);
}

int HandleRequest(int fd, LocalPlayer *localPlayer, UpnpController *controller,
                  std::vector<UpnpPlayer *> &upnpPlayers)
{
    if (fd < 0)
        return -1;
    if (WaitFd(fd, false)) {
        GuardedRequest in;
        if (ReadRequest(fd, &in) == 0) {
            char out[CTRL_REPLY_SIZE];
            AnswerRequest(&in.request, out, localPlayer, controller, upnpPlayers);
            if (WaitFd(fd, true)) {
                ssize_t w = write(fd, out, sizeof(out));
                (void)w;  // a client that went away is its own loss
            }
        }
    }
    close(fd);
    return -1;
}

// ---------------------------------------------------------------------------
// Requests from the loop's connections.

// Reads the one request of a ready connection (one read, as ever), answers
// it and hands the reply to the connection set.
void ServeRequest(DaemonContext &ctx, int fd)
{
    GuardedRequest in;
    if (ReadRequest(fd, &in) != 0) {
        ctx.conns.Close(fd);
        return;
    }
    char out[CTRL_REPLY_SIZE];
    AnswerRequest(&in.request, out, ctx.localPlayer, ctx.controller, ctx.upnpPlayers);
    ctx.conns.Reply(fd, out, sizeof(out));
}
