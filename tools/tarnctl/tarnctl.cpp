// tarnctl: command-line client of tarnaudiod.
//
// Sends one control request per action to the daemon's control socket and
// shows the reply in readable form (or, with --json, as the daemon sent it).
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <poll.h>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>
#include <vector>

#include <json/json.h>

#include "daemon/ctrl.h"
#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "platform/tarn_version.h"

namespace {

bool g_json = false;
int g_timeoutMs = 3000;
int g_page = 10;
volatile sig_atomic_t g_stop = 0;

void Usage(FILE *out)
{
    fprintf(out,
            "usage: tarnctl [--json] [--timeout MS] COMMAND [ARGS]\n"
            "\n"
            "Playback:\n"
            "  play | pause            play or pause the current song\n"
            "  play N                  play queue entry N (0 = first)\n"
            "  stop | next | prev\n"
            "  seek SECONDS            seek within the current song\n"
            "  mute                    toggle muting\n"
            "  volume N|up|down        set the volume (0-100) or step it by 3\n"
            "  eq G1 ... G10           send ten equalizer gains (dB)\n"
            "Queue:\n"
            "  queue [list] [--page N] show the queue (fetched N entries at a time, default 10)\n"
            "  queue add FILE...       append songs (also: tarnctl add FILE...)\n"
            "  queue insert POS FILE   insert a song before POS\n"
            "  queue remove N | clear | current N\n"
            "  repeat normal|one|all|cycle\n"
            "  shuffle                 switch shuffle on or off\n"
            "Sources:\n"
            "  source random|radio|ipod|playlist|next|prev\n"
            "  source custom N         load custom slot N\n"
            "  save N                  store the current source in custom slot N\n"
            "Players and network:\n"
            "  servers | renderers     list media servers / renderers found so far\n"
            "  search servers|renderers\n"
            "  select local|-1|N|NAME  play on the local output or on a renderer\n"
            "Status:\n"
            "  status                  one status line\n"
            "  watch [--count N] [--interval MS]  live status from the status segment\n"
            "  changed set|clear       set or clear the changed flag\n");
}

int Fail(const char *fmt, const char *arg = "")
{
    fprintf(stderr, "tarnctl: ");
    fprintf(stderr, fmt, arg);
    fprintf(stderr, "\n");
    return 1;
}

long long NowMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

// Sends one request; the reply text (up to its NUL) goes to *reply.
// 0 on success; 1 after printing why not.
int Send(const ControlRequest &request, std::string *reply)
{
    std::string path = TarnPath(TARN_CTRL_SOCKET);
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return Fail("cannot create a socket: %s", strerror(errno));
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
    if (connect(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) != 0) {
        int err = errno;
        close(fd);
        if (err == EACCES) {
            fprintf(stderr,
                    "tarnctl: permission denied: %s belongs to the group set by audio_group in\n"
                    "%s; ask to be added to that group.\n",
                    path.c_str(), TarnPath(TARN_INFO_CONF).c_str());
            return 1;
        }
        fprintf(stderr,
                "tarnctl: tarnaudiod is not running (cannot connect to %s: %s).\n"
                "Start it with scripts/run.sh, or run build/bin/tarnaudiod as root.\n",
                path.c_str(), strerror(err));
        return 1;
    }
    if (write(fd, &request, sizeof(request)) != static_cast<ssize_t>(sizeof(request))) {
        int err = errno;
        close(fd);
        return Fail("cannot send the request: %s", strerror(err));
    }
    std::string data;
    long long end = NowMs() + g_timeoutMs;
    while (data.size() < CTRL_REPLY_SIZE) {
        long long left = end - NowMs();
        if (left <= 0)
            break;
        struct pollfd p = {fd, POLLIN, 0};
        int r = poll(&p, 1, static_cast<int>(left));
        if (r < 0 && errno == EINTR)
            continue;
        if (r <= 0)
            break;
        char buf[CTRL_REPLY_SIZE];
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n <= 0)
            break;
        data.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    if (data.empty()) {
        fprintf(stderr,
                "tarnctl: tarnaudiod did not answer within %d ms (busy or stuck). Try again;\n"
                "if it keeps failing, see the system log (ident tarnaudiod) and restart it.\n",
                g_timeoutMs);
        return 1;
    }
    if (reply)
        *reply = std::string(data.c_str());
    return 0;
}

ControlRequest Make(int action, const std::string &param = std::string())
{
    ControlRequest r;
    memset(&r, 0, sizeof(r));
    r.action = action;
    snprintf(r.parameter, sizeof(r.parameter), "%s", param.c_str());
    return r;
}

bool ParseJson(const std::string &text, Json::Value &out)
{
    Json::CharReaderBuilder b;
    std::string errs;
    std::unique_ptr<Json::CharReader> reader(b.newCharReader());
    return reader->parse(text.data(), text.data() + text.size(), &out, &errs);
}

// A reply of 8191 characters that does not parse was cut by the daemon.
bool IsCut(const std::string &text)
{
    Json::Value v;
    return text.size() >= CTRL_REPLY_SIZE - 1 && !ParseJson(text, v);
}

// Sends and prints the raw reply when --json was given. 0 or 1.
int Simple(int action, const std::string &param = std::string())
{
    std::string reply;
    if (Send(Make(action, param), &reply) != 0)
        return 1;
    if (g_json)
        fputs(reply.c_str(), stdout);
    return 0;
}

bool IsInt(const char *s)
{
    if (!s || !*s)
        return false;
    char *end = nullptr;
    strtol(s, &end, 10);
    return *end == '\0';
}

std::string Clock(int seconds)
{
    if (seconds < 0)
        seconds = 0;
    char buf[32];
    if (seconds >= 3600)
        snprintf(buf, sizeof(buf), "%d:%02d:%02d", seconds / 3600, seconds / 60 % 60, seconds % 60);
    else
        snprintf(buf, sizeof(buf), "%d:%02d", seconds / 60, seconds % 60);
    return buf;
}

const char *StateName(int state)
{
    switch (state) {
    case 0: return "none";
    case 1: return "stopped";
    case 2: return "playing";
    case 3: return "paused";
    case 4: return "transitioning";
    case 5: return "ended";
    default: return "unknown";
    }
}

std::string Bar(int position, int duration, int width)
{
    int filled = duration > 0 ? static_cast<int>(static_cast<long long>(position) * width / duration) : 0;
    if (filled > width)
        filled = width;
    if (filled < 0)
        filled = 0;
    return "[" + std::string(static_cast<size_t>(filled), '#') +
           std::string(static_cast<size_t>(width - filled), '-') + "]";
}

// ---- media records -----------------------------------------------------------

TARN_MEDIA_INFO RecordFor(const char *file)
{
    TARN_MEDIA_INFO info;
    memset(&info, 0, sizeof(info));
    std::string path = file;
    if (path.find("://") == std::string::npos && path[0] != '/') {
        char cwd[4096];
        if (getcwd(cwd, sizeof(cwd)))
            path = std::string(cwd) + "/" + path;
    }
    snprintf(info.path, sizeof(info.path), "%s", path.c_str());
    std::string title = path;
    size_t slash = title.rfind('/');
    if (slash != std::string::npos)
        title = title.substr(slash + 1);
    size_t dot = title.rfind('.');
    if (dot != std::string::npos && dot > 0)
        title = title.substr(0, dot);
    snprintf(info.title, sizeof(info.title), "%s", title.c_str());
    return info;
}

int QueueAdd(int argc, char **argv)
{
    if (argc < 1)
        return Fail("queue add: give at least one FILE");
    for (int i = 0; i < argc; ++i) {
        ControlRequest r = Make(ACT_QUEUE_ADD);
        TARN_MEDIA_INFO info = RecordFor(argv[i]);
        memcpy(r.parameter, &info, sizeof(info));
        if (Send(r, nullptr) != 0)
            return 1;
        if (!g_json)
            printf("added %s\n", info.path);
    }
    return 0;
}

int QueueInsert(int argc, char **argv)
{
    if (argc != 2 || !IsInt(argv[0]))
        return Fail("queue insert: give POS FILE");
    ControlRequest r = Make(ACT_QUEUE_INSERT);
    TARN_MEDIA_INFO info = RecordFor(argv[1]);
    memcpy(r.parameter, &info, sizeof(info));
    int32_t pos = static_cast<int32_t>(strtol(argv[0], nullptr, 10));
    memcpy(reinterpret_cast<char *>(&r) + CTRL_INSERT_POS_OFFSET, &pos, sizeof(pos));
    if (Send(r, nullptr) != 0)
        return 1;
    if (!g_json)
        printf("inserted %s at %d\n", info.path, pos);
    return 0;
}

// Fetches the whole queue page by page; 0, or 1 after printing why not.
int FetchQueue(Json::Value &items, Json::Value &head)
{
    items = Json::Value(Json::arrayValue);
    for (int start = 0; start < 1000000; start += g_page) {
        std::string reply;
        char param[64];
        snprintf(param, sizeof(param), "%d %d", start, g_page);
        if (Send(Make(ACT_QUEUE_LIST, param), &reply) != 0)
            return 1;
        Json::Value page;
        if (IsCut(reply)) {
            fprintf(stderr,
                    "tarnctl: the daemon's reply was cut at %d characters; ask a smaller page "
                    "(e.g. --page %d)\n",
                    CTRL_REPLY_SIZE - 1, g_page > 1 ? g_page / 2 : 1);
            return 1;
        }
        if (!ParseJson(reply, page) || !page.isObject())
            return Fail("unexpected reply to the queue listing: %s", reply.c_str());
        head = page;
        const Json::Value &uris = page["uris"];
        for (const Json::Value &u : uris)
            items.append(u);
        int total = page.get("total", 0).asInt();
        if (uris.empty() || start + g_page >= total)
            break;
    }
    return 0;
}

int QueueList()
{
    Json::Value items, head;
    if (FetchQueue(items, head) != 0)
        return 1;
    if (g_json) {
        Json::Value all = head;
        all["uris"] = items;
        Json::StreamWriterBuilder w;
        printf("%s\n", Json::writeString(w, all).c_str());
        return 0;
    }
    int total = head.get("total", 0).asInt();
    int current = head.get("current", 0).asInt();
    printf("%d songs, mode %s, shuffle %s\n", total, head.get("mode", "").asString().c_str(),
           head.get("shuffle", 0).asInt() ? "on" : "off");
    if (total == 0)
        return 0;
    printf("  %5s  %-32s %-20s %7s\n", "#", "TITLE", "ARTIST", "TIME");
    for (const Json::Value &u : items) {
        int seq = u.get("sequence", 0).asInt();
        printf("%c %5d  %-32.32s %-20.20s %7s\n", seq == current ? '>' : ' ', seq,
               u.get("title", "").asString().c_str(), u.get("artist", "").asString().c_str(),
               Clock(u.get("duration", 0).asInt()).c_str());
    }
    return 0;
}

int Queue(int argc, char **argv)
{
    if (argc == 0 || !strcmp(argv[0], "list"))
        return QueueList();
    std::string sub = argv[0];
    if (sub == "add")
        return QueueAdd(argc - 1, argv + 1);
    if (sub == "insert")
        return QueueInsert(argc - 1, argv + 1);
    if (sub == "clear")
        return Simple(ACT_QUEUE_CLEAR);
    if ((sub == "remove" || sub == "current") && argc == 2 && IsInt(argv[1]))
        return Simple(sub == "remove" ? ACT_QUEUE_REMOVE : ACT_QUEUE_SET_CURRENT, argv[1]);
    return Fail("queue: unknown or incomplete subcommand '%s' (list, add, insert, remove N, clear, current N)",
                argv[0]);
}

// ---- status ------------------------------------------------------------------

int Status()
{
    std::string reply;
    if (Send(Make(ACT_GET_STATUS), &reply) != 0)
        return 1;
    if (g_json) {
        fputs(reply.c_str(), stdout);
        return 0;
    }
    Json::Value st;
    if (!ParseJson(reply, st))
        return Fail("unexpected status reply: %s", reply.c_str());
    if (st.isNull()) {
        printf("no player selected (the selected renderer is gone); use 'tarnctl select local'\n");
        return 0;
    }
    std::string state, uri, volume;
    int duration = 0, position = 0;
    std::string where = "local";
    if (st.isMember("PlayerState")) {
        state = StateName(st["PlayerState"].asInt());
        uri = st.get("CurrentUri", "").asString();
        duration = st.get("Duration", 0).asInt();
        position = st.get("Position", 0).asInt();
        volume = std::to_string(st.get("Volume", 0).asInt());
        std::string station = st.get("RadioStation", "").asString();
        if (!station.empty())
            uri = station + ": " + st.get("StreamTitle", "").asString();
    } else {
        where = "renderer " + st.get("RendererFriendlyName", "?").asString();
        state = st.get("TransportState", "unknown").asString();
        uri = st.get("CurrentURI", "").asString();
        duration = st.get("Duration", 0).asInt();
        position = st.get("RelTime", 0).asInt();
        volume = st.get("Volume", "").asString();
    }
    // The current song's title from the queue.
    std::string title;
    std::string queueInfo;
    if (Send(Make(ACT_QUEUE_LIST, "0 1"), &reply) == 0) {
        Json::Value q;
        if (ParseJson(reply, q) && q.isObject()) {
            int total = q.get("total", 0).asInt();
            int current = q.get("current", 0).asInt();
            queueInfo = total ? "[" + std::to_string(current + 1) + "/" + std::to_string(total) + "] "
                              : "[empty queue] ";
            queueInfo += std::string("repeat ") + q.get("mode", "").asString() + ", shuffle " +
                         (q.get("shuffle", 0).asInt() ? "on" : "off");
            if (total > 0) {
                char param[32];
                snprintf(param, sizeof(param), "%d 1", current);
                Json::Value cur;
                if (Send(Make(ACT_QUEUE_LIST, param), &reply) == 0 && ParseJson(reply, cur) &&
                    cur["uris"].size() == 1) {
                    title = cur["uris"][0].get("title", "").asString();
                    std::string artist = cur["uris"][0].get("artist", "").asString();
                    if (!artist.empty())
                        title += " - " + artist;
                }
            }
        }
    }
    printf("%s %s %s/%s vol %s %s\n", where.c_str(), state.c_str(), Clock(position).c_str(),
           Clock(duration).c_str(), volume.c_str(), queueInfo.c_str());
    if (!title.empty() || !uri.empty())
        printf("  %s%s%s\n", title.c_str(), title.empty() ? "" : "  ", uri.c_str());
    return 0;
}

void OnSignal(int)
{
    g_stop = 1;
}

int Watch(int argc, char **argv)
{
    int count = -1;
    int interval = 500;
    for (int i = 0; i < argc; ++i) {
        if (!strcmp(argv[i], "--count") && i + 1 < argc)
            count = atoi(argv[++i]);
        else if (!strcmp(argv[i], "--interval") && i + 1 < argc)
            interval = atoi(argv[++i]);
        else
            return Fail("watch: unknown argument '%s' (--count N, --interval MS)", argv[i]);
    }
    if (interval < 50)
        interval = 50;
    int id = shmget(TarnShmKeyPublished(), TARN_SHM_PUBLISHED_SIZE, 0);
    if (id < 0) {
        fprintf(stderr,
                "tarnctl: no published status segment (key %d): %s.\n"
                "Is tarnaudiod running? Start it with scripts/run.sh.\n",
                TarnShmKeyPublished(), strerror(errno));
        return 1;
    }
    void *p = shmat(id, nullptr, SHM_RDONLY);
    if (p == reinterpret_cast<void *>(-1) && errno == EACCES)
        return Fail("permission denied: the status segment belongs to the group set by audio_group in %s",
                    TarnPath(TARN_INFO_CONF).c_str());
    if (p == reinterpret_cast<void *>(-1))
        return Fail("cannot attach the status segment: %s", strerror(errno));
    const PublishedStatusShm *seg = static_cast<const PublishedStatusShm *>(p);
    signal(SIGINT, OnSignal);
    signal(SIGTERM, OnSignal);
    bool tty = isatty(1);
    for (int n = 0; !g_stop && (count < 0 || n < count); ++n) {
        // Copy first: the daemon rewrites the segment while we read.
        PublishedStatusShm s;
        memcpy(&s, seg, sizeof(s));
        s.currentUri[sizeof(s.currentUri) - 1] = '\0';
        s.title[sizeof(s.title) - 1] = '\0';
        s.artist[sizeof(s.artist) - 1] = '\0';
        std::string title = s.title[0] ? s.title : s.currentUri;
        if (s.artist[0])
            title += std::string(" - ") + s.artist;
        char line[512];
        snprintf(line, sizeof(line), "%-8s %s %s/%s vol %d #%d %s%s%s %-40.40s", StateName(s.state),
                 Bar(s.position, s.duration, 20).c_str(), Clock(s.position).c_str(),
                 Clock(s.duration).c_str(), s.volume, s.index,
                 s.repeatMode == 2 ? "repeat-one " : s.repeatMode == 3 ? "repeat-all " : "",
                 s.shuffle ? "shuffle " : "", s.changed ? "* " : "", title.c_str());
        if (tty)
            printf("\r%s", line);
        else
            printf("%s\n", line);
        fflush(stdout);
        if (count >= 0 && n + 1 >= count)
            break;
        usleep(static_cast<useconds_t>(interval) * 1000);
    }
    if (tty)
        printf("\n");
    shmdt(p);
    return 0;
}

// ---- players -----------------------------------------------------------------

int ListDevices(bool renderers)
{
    std::string reply;
    if (Send(Make(renderers ? ACT_LIST_RENDERERS : ACT_LIST_SERVERS, "0 100"), &reply) != 0)
        return 1;
    if (g_json) {
        fputs(reply.c_str(), stdout);
        return 0;
    }
    Json::Value v;
    if (IsCut(reply))
        return Fail("the list was cut at 8191 characters; use --json with fewer devices");
    if (!ParseJson(reply, v) || !v.isObject())
        return Fail("unexpected reply: %s", reply.c_str());
    const Json::Value &list = v["list"];
    printf("%u %s", v.get("total", 0).asUInt(), renderers ? "renderers" : "media servers");
    if (renderers && v.get("total", 0).asUInt() > 0)
        printf(" (current %u)", v.get("current", 0).asUInt());
    printf("\n");
    for (const Json::Value &d : list) {
        printf("  %3d  %-32.32s %s:%s %s\n", d.get("index", 0).asInt(),
               d.get("friendly_name", "").asString().c_str(), d.get("ip", "").asString().c_str(),
               d.get("port", "").asString().c_str(), d.get("udn", "").asString().c_str());
    }
    return 0;
}

int Select(const char *arg)
{
    std::string which = arg;
    if (which == "local" || which == "-1")
        return Simple(ACT_SELECT_PLAYER, "-1");
    if (IsInt(arg))
        return Simple(ACT_SELECT_PLAYER, arg);
    // A name: look it up in the renderer list.
    std::string reply;
    if (Send(Make(ACT_LIST_RENDERERS, "0 100"), &reply) != 0)
        return 1;
    Json::Value v;
    if (!ParseJson(reply, v))
        return Fail("unexpected renderer list: %s", reply.c_str());
    int found = -1, matches = 0;
    for (const Json::Value &d : v["list"]) {
        std::string name = d.get("friendly_name", "").asString();
        if (name == which) {
            found = d.get("index", 0).asInt();
            matches = 1;
            break;
        }
        if (strcasestr(name.c_str(), arg)) {
            found = d.get("index", 0).asInt();
            ++matches;
        }
    }
    if (matches == 0)
        return Fail("no renderer named '%s' (see 'tarnctl renderers'; 'tarnctl search renderers' looks again)",
                    arg);
    if (matches > 1)
        return Fail("'%s' matches several renderers; give the full name or the index", arg);
    int rc = Simple(ACT_SELECT_PLAYER, std::to_string(found));
    if (rc == 0 && !g_json)
        printf("selected renderer %d\n", found);
    return rc;
}

int Source(int argc, char **argv)
{
    if (argc < 1)
        return Fail("source: give random, radio, ipod, playlist, custom N, next or prev");
    std::string s = argv[0];
    if (s == "random") return Simple(ACT_SOURCE_RANDOM);
    if (s == "radio") return Simple(ACT_SOURCE_RADIO);
    if (s == "ipod") return Simple(ACT_SOURCE_IPOD);
    if (s == "playlist") return Simple(ACT_SOURCE_PLAYLIST);
    if (s == "next") return Simple(ACT_SOURCE_NEXT);
    if (s == "prev" || s == "previous") return Simple(ACT_SOURCE_PREVIOUS);
    if (s == "custom" && argc == 2 && IsInt(argv[1])) return Simple(ACT_SOURCE_CUSTOM, argv[1]);
    return Fail("source: unknown source '%s'", argv[0]);
}

int Repeat(const char *arg)
{
    std::string m = arg;
    if (m == "cycle") return Simple(ACT_CYCLE_REPEAT_MODE);
    const char *code = nullptr;
    if (m == "normal" || m == "off" || m == "1") code = "1";
    else if (m == "one" || m == "2") code = "2";
    else if (m == "all" || m == "3") code = "3";
    if (!code)
        return Fail("repeat: give normal, one, all or cycle (not '%s')", arg);
    return Simple(ACT_SET_REPEAT_MODE, code);
}

int Equalizer(int argc, char **argv)
{
    if (argc != 10)
        return Fail("eq: give exactly ten gains, e.g. tarnctl eq 0 0 1.5 3 0 0 0 -2 0 0%s");
    float gains[10];
    for (int i = 0; i < 10; ++i) {
        char *end = nullptr;
        gains[i] = strtof(argv[i], &end);
        if (!end || *end)
            return Fail("eq: '%s' is not a number", argv[i]);
    }
    char text[CTRL_PARAM_SIZE];
    CtrlFormatEqualizer(gains, text, sizeof(text));
    return Simple(ACT_SET_EQUALIZER, text);
}

}  // namespace

int main(int argc, char **argv)
{
    int i = 1;
    for (; i < argc && argv[i][0] == '-' && argv[i][1] == '-'; ++i) {
        std::string opt = argv[i];
        if (opt == "--json")
            g_json = true;
        else if (opt == "--timeout" && i + 1 < argc)
            g_timeoutMs = atoi(argv[++i]);
        else if (opt == "--help") {
            Usage(stdout);
            return 0;
        } else if (opt == "--version") {
            printf("tarnctl %s\n", TARN_VERSION);
            return 0;
        } else {
            Fail("unknown option '%s' (see tarnctl --help)", argv[i]);
            return 2;
        }
    }
    if (i >= argc) {
        Usage(stderr);
        return 2;
    }
    std::string cmd = argv[i];
    int n = argc - i - 1;
    char **args = argv + i + 1;
    // --page N may follow the queue command.
    std::vector<char *> rest;
    for (int k = 0; k < n; ++k) {
        if (!strcmp(args[k], "--page") && k + 1 < n) {
            g_page = atoi(args[++k]);
            if (g_page < 1)
                g_page = 1;
        } else if (!strcmp(args[k], "--json")) {
            g_json = true;
        } else {
            rest.push_back(args[k]);
        }
    }
    if (cmd != "watch") {
        n = static_cast<int>(rest.size());
        rest.push_back(nullptr);
        args = rest.data();
    }

    if (cmd == "help") {
        Usage(stdout);
        return 0;
    }
    if ((cmd == "play" || cmd == "pause") && n == 0) return Simple(ACT_PLAY_PAUSE);
    if (cmd == "play" && n == 1 && IsInt(args[0])) return Simple(ACT_PLAY_INDEX, args[0]);
    if (cmd == "stop" && n == 0) return Simple(ACT_STOP);
    if (cmd == "next" && n == 0) return Simple(ACT_NEXT);
    if ((cmd == "prev" || cmd == "previous") && n == 0) return Simple(ACT_PREVIOUS);
    if (cmd == "seek" && n == 1 && IsInt(args[0])) return Simple(ACT_SEEK, args[0]);
    if (cmd == "mute" && n == 0) return Simple(ACT_MUTE);
    if (cmd == "volume" && n == 1) {
        if (!strcmp(args[0], "up")) return Simple(ACT_VOLUME_UP);
        if (!strcmp(args[0], "down")) return Simple(ACT_VOLUME_DOWN);
        if (IsInt(args[0])) return Simple(ACT_SET_VOLUME, args[0]);
    }
    if (cmd == "queue") return Queue(n, args);
    if (cmd == "add") return QueueAdd(n, args);
    if (cmd == "repeat" && n == 1) return Repeat(args[0]);
    if (cmd == "shuffle" && n == 0) return Simple(ACT_TOGGLE_SHUFFLE);
    if (cmd == "source") return Source(n, args);
    if (cmd == "save" && n == 1 && IsInt(args[0])) return Simple(ACT_SAVE_CUSTOM, args[0]);
    if (cmd == "select" && n == 1) return Select(args[0]);
    if (cmd == "servers" && n == 0) return ListDevices(false);
    if (cmd == "renderers" && n == 0) return ListDevices(true);
    if (cmd == "search" && n == 1 && !strcmp(args[0], "servers")) return Simple(ACT_SEARCH_SERVERS);
    if (cmd == "search" && n == 1 && !strcmp(args[0], "renderers")) return Simple(ACT_SEARCH_RENDERERS);
    if (cmd == "status" && n == 0) return Status();
    if (cmd == "watch") return Watch(n, args);
    if (cmd == "eq") return Equalizer(n, args);
    if (cmd == "changed" && n == 1 && !strcmp(args[0], "set")) return Simple(ACT_SET_CHANGED);
    if (cmd == "changed" && n == 1 && !strcmp(args[0], "clear")) return Simple(ACT_CLEAR_CHANGED);
    fprintf(stderr, "tarnctl: unknown command or wrong arguments: %s\n\n", cmd.c_str());
    Usage(stderr);
    return 2;
}
