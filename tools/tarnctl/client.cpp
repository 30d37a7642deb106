#include "tools/tarnctl/client.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "daemon/ctrl.h"
#include "platform/tarn_env.h"
#include "platform/tarn_shm.h"

bool g_json = false;
int g_timeoutMs = 3000;

namespace {

void Say(const char *fmt, va_list ap)
{
    fputs("tarnctl: ", stderr);
    vfprintf(stderr, fmt, ap);
    fputc('\n', stderr);
}

bool Parse(const std::string &text, Json::Value *out)
{
    Json::CharReaderBuilder b;
    std::string errs;
    std::unique_ptr<Json::CharReader> reader(b.newCharReader());
    return reader->parse(text.data(), text.data() + text.size(), out, &errs);
}

}  // namespace

int Fail(const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    Say(fmt, ap);
    va_end(ap);
    return kExitFail;
}

void Warn(const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    Say(fmt, ap);
    va_end(ap);
}

ControlRequest MakeRequest(int action, const std::string &param)
{
    ControlRequest r;
    memset(&r, 0, sizeof(r));
    r.action = action;
    snprintf(r.parameter, sizeof(r.parameter), "%s", param.c_str());
    return r;
}

int Send(const ControlRequest &request, std::string *reply)
{
    std::vector<char> buf(CTRL_REPLY_SIZE + 1, '\0');
    int err = 0;
    if (CtrlSendRequestTimed(&request, buf.data(), CTRL_REPLY_SIZE, g_timeoutMs, &err) != 0) {
        std::string path = TarnPath(TARN_CTRL_SOCKET);
        switch (err) {
        case ENOENT:
        case ECONNREFUSED:
        case ENOTDIR:
            return Fail("tarnaudiod is not running (nothing listens on %s). Start it with "
                        "scripts/run.sh, or run tarnaudiod as root.",
                        path.c_str());
        case EACCES:
        case EPERM:
            return Fail("permission denied: %s belongs to the group set by audio_group in %s; "
                        "ask to be added to that group (or run tarnctl as root)",
                        path.c_str(), TarnPath(TARN_INFO_CONF).c_str());
        case ETIMEDOUT:
            return Fail("tarnaudiod did not answer within %d ms (busy or stuck); try again, "
                        "or see the system log",
                        g_timeoutMs);
        case EPIPE:
            return Fail("tarnaudiod closed the connection without an answer");
        default:
            return Fail("cannot talk to tarnaudiod on %s: %s", path.c_str(), strerror(err));
        }
    }
    if (reply)
        *reply = std::string(buf.data());
    return 0;
}

int Request(int action, const std::string &param, Json::Value *reply, bool print)
{
    std::string text;
    if (Send(MakeRequest(action, param), &text) != 0)
        return kExitFail;
    if (print && g_json)
        fputs(text.c_str(), stdout);
    Json::Value v;
    if (!Parse(text, &v)) {
        if (text.size() >= CTRL_REPLY_SIZE - 1)
            return Fail("the daemon's reply was cut at %d characters", CTRL_REPLY_SIZE - 1);
        return Fail("unexpected reply from tarnaudiod: %s", text.c_str());
    }
    if (v.isObject() && v.isMember("error") && v["error"].isString())
        return Fail("%s", v["error"].asCString());
    if (reply)
        *reply = v;
    return 0;
}

const char *StateWord(int state)
{
    switch (state) {
    case kPlaying: return "playing";
    case kPaused: return "paused";
    default: return "stopped";
    }
}

const char *RepeatWord(int mode)
{
    switch (mode) {
    case REPEAT_MODE_ONE: return "one";
    case REPEAT_MODE_ALL: return "all";
    default: return "off";
    }
}

int RepeatMode(const std::string &name)
{
    if (name == "Repeat One")
        return REPEAT_MODE_ONE;
    if (name == "Repeat All")
        return REPEAT_MODE_ALL;
    return REPEAT_MODE_OFF;
}

int JsonInt(const Json::Value &v, const char *key, int fallback)
{
    if (!v.isObject() || !v.isMember(key))
        return fallback;
    const Json::Value &x = v[key];
    if (x.isInt() || x.isUInt())
        return x.asInt();
    if (x.isBool())
        return x.asBool() ? 1 : 0;
    if (x.isString()) {
        const char *s = x.asCString();
        char *end = nullptr;
        long n = strtol(s, &end, 10);
        return end == s ? fallback : static_cast<int>(n);
    }
    if (x.isDouble())
        return static_cast<int>(x.asDouble());
    return fallback;
}

int GetEntry(int index, Json::Value *entry)
{
    Json::Value page;
    if (Request(ACT_QUEUE_LIST, std::to_string(index) + " 1", &page) != 0)
        return kExitFail;
    *entry = page["uris"].isArray() && page["uris"].size() == 1 ? page["uris"][0] : Json::Value();
    return 0;
}

int GetSnapshot(Snapshot *s, bool withSong)
{
    *s = Snapshot();
    Json::Value st;
    if (Request(ACT_GET_STATUS, "", &st) != 0)
        return kExitFail;
    s->status = st;
    if (st.isNull()) {
        s->selected = false;
        return 0;
    }
    if (st.isMember("PlayerState")) {
        int raw = JsonInt(st, "PlayerState");
        s->state = (raw == PLAYER_STATE_PLAYING || raw == PLAYER_STATE_TRANSITIONING) ? kPlaying
                   : raw == PLAYER_STATE_PAUSED                                        ? kPaused
                                                                                       : kStopped;
        s->playerRunning = JsonInt(st, "fdMplayer", -1) >= 0;
        s->uri = st.get("CurrentUri", "").asString();
        s->duration = JsonInt(st, "Duration", -1);
        s->position = JsonInt(st, "Position", 0);
        s->volume = JsonInt(st, "Volume", 0);
        s->muted = JsonInt(st, "Muted", 0) != 0;
        s->lastError = st.get("last_error", "").asString();
        s->errorCount = JsonInt(st, "error_count", 0);
        s->station = st.get("RadioStation", "").asString();
        s->streamTitle = st.get("StreamTitle", "").asString();
    } else {
        s->local = false;
        s->renderer = st.get("RendererFriendlyName", "").asString();
        std::string t = st.get("TransportState", "").asString();
        s->state = (t == "PLAYING" || t == "TRANSITIONING") ? kPlaying
                   : t == "PAUSED_PLAYBACK"                 ? kPaused
                                                            : kStopped;
        s->playerRunning = s->state != kStopped;
        s->uri = st.get("CurrentURI", "").asString();
        s->duration = JsonInt(st, "Duration", -1);
        s->position = JsonInt(st, "RelTime", 0);
        s->volume = JsonInt(st, "Volume", JsonInt(st, "playerVolume", 0));
        s->muted = JsonInt(st, "playerMute", 0) != 0;
    }
    Json::Value q;
    if (Request(ACT_QUEUE_LIST, "0 1", &q) != 0)
        return kExitFail;
    s->total = JsonInt(q, "total");
    s->current = JsonInt(q, "current");
    s->orderIndex = JsonInt(q, "order_index");
    s->repeat = RepeatMode(q.get("mode", "").asString());
    s->shuffle = q.get("shuffle", false).asBool();
    if (withSong && s->total > 0 && s->current < s->total) {
        if (s->current == 0 && q["uris"].size() == 1)
            s->song = q["uris"][0];
        else if (GetEntry(s->current, &s->song) != 0)
            return kExitFail;
    }
    return 0;
}

std::string ClockText(int seconds)
{
    if (seconds < 0)
        return "-";
    char buf[32];
    if (seconds >= 3600)
        snprintf(buf, sizeof(buf), "%d:%02d:%02d", seconds / 3600, seconds / 60 % 60, seconds % 60);
    else
        snprintf(buf, sizeof(buf), "%d:%02d", seconds / 60, seconds % 60);
    return buf;
}

const PublishedStatusShm *AttachPublished(bool quiet)
{
    TarnShmStep failed = TARN_SHM_STEP_NONE;
    void *p = TarnShmAttach(TarnShmKeyPublished(), TARN_SHM_PUBLISHED_SIZE, TARN_SHM_READONLY,
                            &failed);
    if (failed == TARN_SHM_STEP_GET) {
        if (!quiet)
            Fail("no published status (segment key %d: %s); is tarnaudiod running?",
                 TarnShmKeyPublished(), strerror(errno));
        return nullptr;
    }
    if (!p) {
        if (!quiet && (errno == EACCES || errno == EPERM))
            Fail("permission denied: the status segment belongs to the group set by audio_group in %s",
                 TarnPath(TARN_INFO_CONF).c_str());
        else if (!quiet)
            Fail("cannot read the published status: %s", strerror(errno));
        return nullptr;
    }
    return static_cast<const PublishedStatusShm *>(p);
}

bool DaemonAlive()
{
    struct stat st;
    if (stat(TarnPath(TARN_CTRL_SOCKET).c_str(), &st) != 0 || !S_ISSOCK(st.st_mode))
        return false;
    FILE *f = fopen(TarnPath(TARN_PID_FILE).c_str(), "r");
    if (!f)
        return true;  // no pid file to go by: the socket says it runs
    int pid = 0;
    int n = fscanf(f, "%d", &pid);
    fclose(f);
    if (n != 1 || pid <= 0)
        return true;
    return kill(pid, 0) == 0 || errno == EPERM;
}
