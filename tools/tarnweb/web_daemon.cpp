// The remote's side of the daemon: single requests over the control socket
// and the live status built from the published status segment.
#include <poll.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstring>

#include "daemon/ctrl.h"
#include "platform/tarn_env.h"
#include "platform/tarn_shm.h"
#include "platform/tarn_log.h"
#include "tools/tarnweb/web_remote.h"

namespace {

int64_t NowMs()
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

std::string Compact(const Json::Value &v)
{
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    b["emitUTF8"] = true;
    return Json::writeString(b, v);
}

const char *StateText(int state, bool haveSong)
{
    if (!haveSong)
        return "Nothing playing";
    switch (state) {
    case PLAYER_STATE_PLAYING:
        return "Playing";
    case PLAYER_STATE_PAUSED:
        return "Paused";
    case PLAYER_STATE_TRANSITIONING:
        return "Loading";
    case PLAYER_STATE_ENDED:
        return "Finished";
    default:
        return "Stopped";
    }
}

}  // namespace

int WebDaemonRequest(const ControlRequest &request, Json::Value *reply, std::string *error,
                     int timeoutMs)
{
    std::string socketPath = TarnPath(TARN_CTRL_SOCKET);
    struct stat st;
    if (stat(socketPath.c_str(), &st) != 0) {
        *error = "the player daemon is not running (no control socket " + socketPath + ")";
        return -1;
    }
    int fd = CtrlConnect();
    if (fd < 0) {
        *error = "the player daemon is not running (cannot connect to " + socketPath + ")";
        return -1;
    }
    // The daemon takes the whole request from one write.
    ssize_t n = write(fd, &request, sizeof(request));
    if (n != static_cast<ssize_t>(sizeof(request))) {
        close(fd);
        *error = "the player daemon did not take the request";
        return -1;
    }
    std::string text;
    char buffer[CTRL_REPLY_SIZE];
    int64_t deadline = NowMs() + timeoutMs;
    while (text.size() < CTRL_REPLY_SIZE) {
        int left = static_cast<int>(deadline - NowMs());
        struct pollfd p = {fd, POLLIN, 0};
        if (left <= 0 || poll(&p, 1, left) <= 0)
            break;
        ssize_t got = read(fd, buffer, sizeof(buffer));
        if (got <= 0)
            break;
        text.append(buffer, static_cast<size_t>(got));
        if (memchr(buffer, '\0', static_cast<size_t>(got)))
            break;
    }
    close(fd);
    if (text.empty()) {
        *error = "the player daemon did not answer in time";
        return -1;
    }
    text.resize(strnlen(text.data(), text.size()));
    Json::CharReaderBuilder rb;
    std::unique_ptr<Json::CharReader> parser(rb.newCharReader());
    Json::Value value;
    std::string why;
    if (!parser->parse(text.data(), text.data() + text.size(), &value, &why)) {
        *error = "the player daemon's answer was cut or unreadable";
        return -1;
    }
    if (reply)
        *reply = value;
    return 0;
}

int WebDaemonAction(int action, const std::string &text, Json::Value *reply, std::string *error,
                    int timeoutMs)
{
    ControlRequest request;
    memset(&request, 0, sizeof(request));
    request.action = action;
    snprintf(request.parameter, sizeof(request.parameter), "%s", text.c_str());
    return WebDaemonRequest(request, reply, error, timeoutMs);
}

// ---------------------------------------------------------------------------

StatusHub::StatusHub(int interval) : intervalMs(interval < 250 ? 250 : interval)
{
    memset(&last, 0, sizeof(last));
}

StatusHub::~StatusHub()
{
    Stop();
    if (segment)
        shmdt(segment);
}

void StatusHub::Start()
{
    std::lock_guard<std::mutex> lock(mutex);
    if (running)
        return;
    running = true;
    reader = std::thread([this] { Loop(); });
}

void StatusHub::Stop()
{
    {
        std::lock_guard<std::mutex> lock(mutex);
        running = false;
    }
    wake.notify_all();
    changed.notify_all();
    if (reader.joinable())
        reader.join();
}

void StatusHub::Kick()
{
    {
        std::lock_guard<std::mutex> lock(mutex);
        kicked = true;
    }
    wake.notify_all();
}

void StatusHub::Subscribe(int delta)
{
    subscribers += delta;
    wake.notify_all();
}

int StatusHub::ReadSegment(PublishedStatusShm *out)
{
    if (!segment) {
        void *at = TarnShmAttach(TarnShmKeyPublished(), TARN_SHM_PUBLISHED_SIZE, TARN_SHM_READONLY);
        if (!at)
            return -1;
        segment = static_cast<const PublishedStatusShm *>(at);
    }
    // No lock between processes: copy, then make the texts safe to read.
    memcpy(out, segment, sizeof(*out));
    out->currentUri[sizeof(out->currentUri) - 1] = '\0';
    out->title[sizeof(out->title) - 1] = '\0';
    out->artist[sizeof(out->artist) - 1] = '\0';
    return 0;
}

// What the segment does not tell: the daemon's status reply (player, radio,
// mute, last error) and the current queue entry.
static Json::Value DaemonExtra(const PublishedStatusShm &now, bool haveSegment)
{
    Json::Value x(Json::objectValue);
    Json::Value status;
    std::string error;
    if (WebDaemonAction(ACT_GET_STATUS, "", &status, &error) != 0) {
        x["daemon"] = false;
        x["error"] = error;
    } else {
        x["daemon"] = true;
        Json::Value player(Json::objectValue);
        if (status.isObject() && status.isMember("RendererIndex")) {
            player["kind"] = "renderer";
            player["index"] = status["RendererIndex"].asInt();
            player["name"] = status.get("RendererFriendlyName", "").asString();
            if (status.isMember("playerMute"))
                x["mute"] = status["playerMute"].asBool();
        } else if (status.isObject()) {
            player["kind"] = "local";
            player["index"] = -1;
            player["name"] = "This device";
            x["radio"] = status.get("RadioStation", "").asString();
            x["streamTitle"] = status.get("StreamTitle", "").asString();
        } else {
            player["kind"] = "none";
            player["index"] = -1;
            player["name"] = "No player (the selected renderer has gone)";
        }
        x["player"] = player;
        std::string err;
        if (status.isObject())
            err = status.get("last_error", status.get("error", "").asString()).asString();
        x["error"] = err;
        Json::Value queue;
        int index = haveSegment && now.currentUri[0] ? now.index : 0;
        if (WebDaemonAction(ACT_QUEUE_LIST, std::to_string(index) + " 1", &queue, &error) == 0 &&
            queue.isObject()) {
            x["total"] = queue.get("total", 0).asInt();
            x["current"] = queue.get("current", 0).asInt();
            const Json::Value &uris = queue["uris"];
            if (uris.isArray() && uris.size() > 0)
                x["item"] = uris[0];
        }
    }
    return x;
}

void StatusHub::Refresh(bool full)
{
    std::lock_guard<std::mutex> refreshLock(refreshMutex);
    PublishedStatusShm now;
    memset(&now, 0, sizeof(now));
    bool haveSegment = ReadSegment(&now) == 0;
    // Anything but the position and volume asks the daemon for the rest.
    bool significant = !haveLast || strcmp(now.currentUri, last.currentUri) != 0 ||
                       now.index != last.index || now.state != last.state ||
                       strcmp(now.title, last.title) != 0 || now.changed != last.changed ||
                       now.shuffle != last.shuffle || now.repeatMode != last.repeatMode;
    if (haveLast && !full && !significant && memcmp(&now, &last, sizeof(now)) == 0)
        return;
    if (full || significant || extra.isNull()) {
        extra = DaemonExtra(now, haveSegment);
        lastFullMs = NowMs();
    }
    last = now;
    haveLast = true;

    Json::Value s(Json::objectValue);
    bool daemon = extra.get("daemon", false).asBool();
    bool song = haveSegment && now.currentUri[0] != '\0';
    s["daemon"] = daemon;
    s["player"] = extra.isMember("player") ? extra["player"] : Json::Value(Json::objectValue);
    s["state"] = song ? now.state : 0;
    s["stateText"] = daemon ? StateText(now.state, song) : "Player daemon not running";
    s["uri"] = song ? now.currentUri : "";
    s["title"] = song ? now.title : "";
    s["artist"] = song ? now.artist : "";
    s["position"] = song ? now.position : 0;
    s["duration"] = song ? now.duration : 0;
    s["volume"] = now.volume;
    s["repeat"] = now.repeatMode >= REPEAT_MODE_OFF && now.repeatMode <= REPEAT_MODE_ALL ? now.repeatMode
                                                                                : REPEAT_MODE_OFF;
    s["shuffle"] = now.shuffle != 0;
    s["index"] = song ? now.index : extra.get("current", 0).asInt();
    s["total"] = extra.get("total", 0).asInt();
    s["mute"] = extra.isMember("mute") ? extra["mute"] : Json::Value();
    s["error"] = extra.get("error", "").asString();
    s["radio"] = extra.get("radio", "").asString();
    s["album"] = "";
    s["art"] = "";
    s["songId"] = 0;
    const Json::Value &item = extra["item"];
    if (song && item.isObject() && item.get("sequence", -1).asInt() == now.index) {
        s["album"] = item.get("album", "").asString();
        unsigned long id = 0;
        sscanf(item.get("item_id", "").asString().c_str(), "playing@%lu", &id);
        s["songId"] = static_cast<Json::UInt>(id);
        if (id)
            s["art"] = "/api/cover/" + std::to_string(id);
        if (!now.title[0])
            s["title"] = item.get("title", "").asString();
    }
    std::string t = Compact(s);
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (t != text) {
            text = t;
            ++seq;
        }
    }
    changed.notify_all();
}

std::string StatusHub::Current()
{
    Refresh(true);
    std::lock_guard<std::mutex> lock(mutex);
    return text;
}

void StatusHub::Loop()
{
    std::unique_lock<std::mutex> lock(mutex);
    while (running) {
        if (!kicked) {
            if (subscribers.load() == 0)
                wake.wait(lock, [this] { return !running || kicked || subscribers.load() > 0; });
            else
                wake.wait_for(lock, std::chrono::milliseconds(intervalMs),
                              [this] { return !running || kicked; });
        }
        if (!running)
            break;
        bool full = kicked || NowMs() - lastFullMs >= 3000;
        kicked = false;
        lock.unlock();
        Refresh(full);
        lock.lock();
    }
}

bool StatusHub::Wait(uint64_t have, uint64_t extrasSeen, int timeoutMs, std::string *out,
                     uint64_t *newSeq)
{
    std::unique_lock<std::mutex> lock(mutex);
    changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                     [&] { return !running || seq != have || extraSeq != extrasSeen; });
    *out = text;
    *newSeq = seq;
    return running;
}

void StatusHub::Publish(const std::string &event, const std::string &json)
{
    {
        std::lock_guard<std::mutex> lock(mutex);
        ++extraSeq;
        extras.push_back({extraSeq, {event, json}});
        if (extras.size() > 16)
            extras.erase(extras.begin());
    }
    changed.notify_all();
}

uint64_t StatusHub::Extras(uint64_t after, std::vector<std::pair<std::string, std::string>> *out)
{
    std::lock_guard<std::mutex> lock(mutex);
    for (auto &e : extras)
        if (e.first > after)
            out->push_back(e.second);
    return extraSeq;
}
