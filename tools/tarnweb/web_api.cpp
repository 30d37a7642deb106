// The remote's routes: the page, the JSON API and the live status stream.
// Reads are GET; every change is a POST with a JSON body (or none) and is
// answered {"ok":true,...} or, with a non-2xx status, {"error":"..."}
// carrying what the daemon, the library or the radio lists reported.
#include <httplib.h>

#include <algorithm>
#include <cstring>
#include <fstream>

#include "audio/info.h"
#include "daemon/ctrl.h"
#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "source/radiolist.h"
#include "tools/tarnweb/web_remote.h"

static const char kLogUnit[] = "tarnweb";

namespace {

const char kCoverFormat[] = "modules/Aurelon/webUI/getcover.cgi/ebdart/%lu.jpg";
const char kPlaceholderArt[] = "modules/Aurelon/images/thumb/thumb_file.png";
const char kEqSystem[] = "/usr/tarn/etc.defaults/audio/equalizer.system";
const char kEqUser[] = "/usr/tarn/etc/audio/equalizer.user";
const int kCustomSlots = 6;      // slots offered by the page: 1..6
const size_t kMostSongsPerAdd = 2000;
// The station list files are read, changed and written whole: one change at a time.
std::mutex radioMutex;

std::string Compact(const Json::Value &v)
{
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    b["emitUTF8"] = true;
    return Json::writeString(b, v);
}

void Reply(httplib::Response &res, const Json::Value &v, int status = 200)
{
    res.status = status;
    res.set_header("Cache-Control", "no-store");
    res.set_content(Compact(v), "application/json");
}

void Error(httplib::Response &res, int status, const std::string &why)
{
    Json::Value v(Json::objectValue);
    v["error"] = why;
    Reply(res, v, status);
}

void Ok(httplib::Response &res, const Json::Value &extra = Json::Value())
{
    Json::Value v = extra.isObject() ? extra : Json::Value(Json::objectValue);
    v["ok"] = true;
    Reply(res, v);
}

// The request's JSON body ({} when empty); false (and a 400) when unreadable.
bool Body(const httplib::Request &req, httplib::Response &res, Json::Value *out)
{
    *out = Json::Value(Json::objectValue);
    if (req.body.empty())
        return true;
    Json::CharReaderBuilder rb;
    std::unique_ptr<Json::CharReader> r(rb.newCharReader());
    std::string why;
    if (!r->parse(req.body.data(), req.body.data() + req.body.size(), out, &why) || !out->isObject()) {
        Error(res, 400, "the request body is not a JSON object");
        return false;
    }
    return true;
}

bool IntField(const Json::Value &body, const char *name, int low, int high, int *out)
{
    const Json::Value &v = body[name];
    if (!v.isNumeric() && !(v.isString() && !v.asString().empty()))
        return false;
    long long n = 0;
    if (v.isNumeric()) {
        n = v.asLargestInt();
    } else {
        char *end = nullptr;
        std::string s = v.asString();
        n = strtoll(s.c_str(), &end, 10);
        if (*end)
            return false;
    }
    if (n < low || n > high)
        return false;
    *out = static_cast<int>(n);
    return true;
}

int Param(const httplib::Request &req, const char *name, int fallback)
{
    if (!req.has_param(name))
        return fallback;
    return atoi(req.get_param_value(name).c_str());
}

// Sends one action; false after answering with the reason. A reply that
// carries "error" (a full queue) counts as refused.
bool Send(httplib::Response &res, int action, const std::string &text, Json::Value *reply = nullptr,
          int timeoutMs = 3000)
{
    Json::Value r;
    std::string error;
    if (WebDaemonAction(action, text, &r, &error, timeoutMs) != 0) {
        Error(res, 503, error);
        return false;
    }
    if (r.isObject() && r.isMember("error") && r["error"].isString() && !r["error"].asString().empty()) {
        Error(res, 409, r["error"].asString());
        return false;
    }
    if (reply)
        *reply = r;
    return true;
}

bool SendRecord(httplib::Response &res, int action, const TARN_MEDIA_INFO &info, int position)
{
    ControlRequest request;
    memset(&request, 0, sizeof(request));
    request.action = action;
    memcpy(request.parameter, &info, sizeof(info));
    if (action == ACT_QUEUE_INSERT) {
        int32_t pos = position;
        memcpy(reinterpret_cast<char *>(&request) + CTRL_INSERT_POS_OFFSET, &pos, sizeof(pos));
    }
    Json::Value r;
    std::string error;
    if (WebDaemonRequest(request, &r, &error) != 0) {
        Error(res, 503, error);
        return false;
    }
    if (r.isObject() && r.isMember("error")) {
        Error(res, 409, r["error"].asString());
        return false;
    }
    return true;
}

void SetCover(TARN_MEDIA_INFO *info)
{
    memset(info->albumArtUrl, 0, sizeof(info->albumArtUrl));
    if (info->id)
        snprintf(info->albumArtUrl, sizeof(info->albumArtUrl), kCoverFormat, static_cast<unsigned long>(info->id));
}

// A queue entry as the page shows it.
Json::Value QueueItem(const Json::Value &u)
{
    Json::Value v(Json::objectValue);
    unsigned long id = 0;
    sscanf(u.get("item_id", "").asString().c_str(), "playing@%lu", &id);
    v["index"] = u.get("sequence", 0).asInt();
    v["id"] = static_cast<Json::UInt>(id);
    v["title"] = u.get("title", "").asString();
    v["artist"] = u.get("artist", "").asString();
    v["album"] = u.get("album", "").asString();
    v["duration"] = u.get("duration", 0).asInt();
    v["art"] = id ? "/api/cover/" + std::to_string(id) : std::string();
    return v;
}

// Rebuilds the record of a queue entry from its list item (for a move).
TARN_MEDIA_INFO RecordFromItem(const Json::Value &u)
{
    TARN_MEDIA_INFO info;
    memset(&info, 0, sizeof(info));
    unsigned long id = 0;
    sscanf(u.get("item_id", "").asString().c_str(), "playing@%lu", &id);
    info.id = static_cast<uint32_t>(id);
    snprintf(info.path, sizeof(info.path), "%s", u.get("res", "").asString().c_str());
    snprintf(info.title, sizeof(info.title), "%s", u.get("title", "").asString().c_str());
    snprintf(info.album, sizeof(info.album), "%s", u.get("album", "").asString().c_str());
    snprintf(info.artist, sizeof(info.artist), "%s", u.get("artist", "").asString().c_str());
    snprintf(info.genre, sizeof(info.genre), "%s", u.get("genre", "").asString().c_str());
    std::string art = u.get("albumArtURL", "").asString();
    if (art != kPlaceholderArt)
        snprintf(info.albumArtUrl, sizeof(info.albumArtUrl), "%s", art.c_str());
    info.track = u.get("track", 0).asInt();
    info.disc = u.get("disc", 0).asInt();
    info.year = u.get("year", 0).asInt();
    info.duration = static_cast<float>(u.get("duration", 0).asInt());
    info.bitrate = u.get("bitrate", 0).asUInt();
    info.sample = u.get("sample", 0).asInt();
    info.channels = u.get("channels", 0).asInt();
    info.size = strtoull(u.get("size", "0").asString().c_str(), nullptr, 10);
    return info;
}

// One page of the queue; the daemon's reply is at most 8191 characters, so
// a page that does not fit is asked for again in halves.
int QueuePage(int start, int limit, Json::Value *out, std::string *error)
{
    for (int tries = 0; tries < 7; ++tries) {
        Json::Value r;
        std::string why;
        if (WebDaemonAction(ACT_QUEUE_LIST, std::to_string(start) + " " + std::to_string(limit), &r, &why) == 0) {
            *out = r;
            return 0;
        }
        if (why.find("cut") == std::string::npos || limit <= 1) {
            *error = why;
            return -1;
        }
        limit /= 2;
    }
    *error = "the queue page does not fit in a reply";
    return -1;
}

struct EqProfile {
    std::string name, gains;
    bool user;
};

void ReadProfiles(const std::string &path, bool user, std::vector<EqProfile> *out)
{
    std::ifstream in(path);
    std::string line;
    while (std::getline(in, line)) {
        size_t colon = line.rfind(':');
        if (colon == std::string::npos || colon == 0)
            continue;
        std::string gains = line.substr(colon + 1);
        char buf[1024];
        snprintf(buf, sizeof(buf), "%s", gains.c_str());
        TLIBCStrTrimSpace(buf, 0);
        out->push_back({line.substr(0, colon), buf, user});
    }
}

Json::Value GainsJson(const std::string &text)
{
    Json::Value a(Json::arrayValue);
    const char *p = text.c_str();
    char *end = nullptr;
    for (int i = 0; i < 10; ++i) {
        double g = strtod(p, &end);
        if (end == p)
            break;
        a.append(g);
        p = end;
    }
    return a;
}

std::string ConfValue(const std::string &conf, const char *key)
{
    char v[1024] = "";
    if (TLIBCFileGetKeyValue(conf.c_str(), key, v, sizeof(v), 0) <= 0)
        return "";
    return v;
}

int ListType(const std::string &name)
{
    if (name == "favorite" || name == "favourite" || name.empty())
        return RADIO_LIST_FAVORITE;
    if (name == "userdef" || name == "user")
        return RADIO_LIST_USERDEF;
    return 0;
}

bool ValidStreamUrl(const std::string &url)
{
    return (url.compare(0, 7, "http://") == 0 || url.compare(0, 8, "https://") == 0 ||
            url.compare(0, 6, "mms://") == 0 || url.compare(0, 7, "rtsp://") == 0) &&
           url.size() < 4000 && url.find_first_of(" \r\n\t") == std::string::npos;
}

}  // namespace

WebRemote::WebRemote(const WebRemoteOptions &opts) : options(opts)
{
    if (options.confPath.empty())
        options.confPath = TarnPath(TARN_INFO_CONF);
    if (options.dbPath.empty())
        options.dbPath = MediaLibDefaultPath();
    if (options.wwwDir.empty())
        options.wwwDir = ConfValue(options.confPath, "web_root");
    if (options.wwwDir.empty())
        options.wwwDir = WebDefaultWwwDir();
    guard.reset(new WebGuard(options.confPath));
    hub.reset(new StatusHub(options.statusIntervalMs));
    library.reset(new LibraryView(options.dbPath));
}

WebRemote::~WebRemote()
{
    Stop();
}

int WebRemote::Init(std::string *why)
{
    return assets.Load(options.wwwDir, why);
}

void WebRemote::Stop()
{
    stopping = true;
    if (hub)
        hub->Stop();
}

void WebRemote::Register(httplib::Server &server)
{
    hub->Start();
    // Song and cover URLs for renderers pass untouched; everything else is
    // checked first.
    server.set_pre_routing_handler([this](const httplib::Request &req, httplib::Response &res) {
        if (req.path.compare(0, 30, "/audio/webUI/audiotransfer.cgi") == 0 ||
            req.path.compare(0, 35, "/modules/Aurelon/webUI/getcover.cgi") == 0)
            return httplib::Server::HandlerResponse::Unhandled;
        res.set_header("Content-Security-Policy",
                       "default-src 'self'; img-src 'self' data:; object-src 'none'; base-uri 'none';"
                       " frame-ancestors 'none'; form-action 'self'");
        if (!guard->Allow(req, res))
            return httplib::Server::HandlerResponse::Handled;
        return httplib::Server::HandlerResponse::Unhandled;
    });
    server.Get("/", [this](const httplib::Request &req, httplib::Response &res) {
        assets.Serve("index.html", false, req, res);
    });
    server.Get("/manifest.webmanifest", [this](const httplib::Request &req, httplib::Response &res) {
        assets.Serve("manifest.webmanifest", false, req, res);
    });
    server.Get(R"(/v/([0-9a-f]{1,64})/([A-Za-z0-9_.-]+))", [this](const httplib::Request &req,
                                                                  httplib::Response &res) {
        std::string name = req.matches[2];
        if (name == "index.html" || !assets.Serve(name, req.matches[1] == assets.Version(), req, res))
            Error(res, 404, "no such file");
    });
    auto cover = [this](const httplib::Request &req, httplib::Response &res) {
        uint32_t id = static_cast<uint32_t>(strtoul(std::string(req.matches[1]).c_str(), nullptr, 10));
        std::string data, type, etag;
        int r = library->Cover(id, &data, &type, &etag);
        if (r != 1) {
            res.status = 404;
            res.set_header("Cache-Control", "max-age=300");
            return;
        }
        res.set_header("Cache-Control", "max-age=86400");
        res.set_header("ETag", etag);
        if (req.get_header_value("If-None-Match") == etag) {
            res.status = 304;
            return;
        }
        res.set_content(data, type.c_str());
    };
    server.Get(R"(/api/cover/(\d{1,10}))", cover);
    server.Get(R"(/modules/Aurelon/webUI/getcover\.cgi/ebdart/(\d{1,10})\.jpg)", cover);
    RegisterApi(server);
}

void WebRemote::RegisterApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Session -----------------------------------------------------------
    server.Get("/api/session", [this](Req req, Res res) {
        Json::Value v(Json::objectValue);
        v["password"] = guard->PasswordSet();
        v["ok"] = !guard->PasswordSet() || guard->HasSession(req);
        Reply(res, v);
    });
    server.Post("/api/login", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        std::string cookie;
        if (!guard->Login(body.get("password", "").asString(), &cookie)) {
            TLOG("Wrong web password from %s", req.remote_addr.c_str());
            usleep(500 * 1000);  // slows guessing down
            Error(res, 403, "wrong password");
            return;
        }
        res.set_header("Set-Cookie", "tarnweb_session=" + cookie + "; Path=/; HttpOnly; SameSite=Strict");
        Ok(res);
    });

    // -- Status --------------------------------------------------------------
    server.Get("/api/status", [this](Req, Res res) {
        res.set_header("Cache-Control", "no-store");
        res.set_content(hub->Current(), "application/json");
    });
    server.Get("/api/events", [this](Req, Res res) {
        if (streams.fetch_add(1) >= options.maxStreams) {
            streams--;
            Error(res, 503, "too many pages listening; close one");
            return;
        }
        hub->Subscribe(1);
        struct Cursor {
            bool first = true;
            uint64_t seq = 0, extras = 0;
        };
        auto cursor = std::make_shared<Cursor>();
        res.set_header("Cache-Control", "no-store");
        res.set_header("X-Accel-Buffering", "no");
        res.set_chunked_content_provider(
            "text/event-stream",
            [this, cursor](size_t, httplib::DataSink &sink) {
                std::string out, text;
                uint64_t seq = 0;
                if (cursor->first) {
                    cursor->first = false;
                    std::vector<std::pair<std::string, std::string>> none;
                    cursor->extras = hub->Extras(UINT64_MAX, &none);
                    text = hub->Current();
                    out = "retry: 2000\n\nevent: status\ndata: " + text + "\n\n";
                    hub->Wait(0, cursor->extras, 0, &text, &cursor->seq);
                } else {
                    if (!hub->Wait(cursor->seq, cursor->extras, 15000, &text, &seq) || stopping)
                        return false;
                    if (seq != cursor->seq)
                        out += "event: status\ndata: " + text + "\n\n";
                    cursor->seq = seq;
                    std::vector<std::pair<std::string, std::string>> extras;
                    cursor->extras = hub->Extras(cursor->extras, &extras);
                    for (auto &e : extras)
                        out += "event: " + e.first + "\ndata: " + e.second + "\n\n";
                    if (out.empty())
                        out = ": still here\n\n";
                }
                return sink.is_writable() && sink.write(out.data(), out.size());
            },
            [this](bool) {
                streams--;
                hub->Subscribe(-1);
            });
    });

    // -- Transport -----------------------------------------------------------
    static const std::pair<const char *, int> simple[] = {
        {"play-pause", ACT_PLAY_PAUSE}, {"stop", ACT_STOP},          {"next", ACT_NEXT},
        {"previous", ACT_PREVIOUS},     {"mute", ACT_MUTE},          {"volume-up", ACT_VOLUME_UP},
        {"volume-down", ACT_VOLUME_DOWN}, {"shuffle", ACT_TOGGLE_SHUFFLE},
    };
    for (auto &s : simple) {
        int action = s.second;
        server.Post(std::string("/api/player/") + s.first, [this, action](Req, Res res) {
            Json::Value r;
            if (Send(res, action, "", &r)) {
                hub->Kick();
                Ok(res);
            }
        });
    }
    server.Post("/api/player/volume", [this](Req req, Res res) {
        Json::Value body;
        int v = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "volume", 0, 100, &v))
            return Error(res, 400, "volume: a number from 0 to 100");
        if (Send(res, ACT_SET_VOLUME, std::to_string(v))) {
            hub->Kick();
            Ok(res);
        }
    });
    server.Post("/api/player/seek", [this](Req req, Res res) {
        Json::Value body;
        int v = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "position", 0, 24 * 3600 * 7, &v))
            return Error(res, 400, "position: seconds from the start of the song");
        if (Send(res, ACT_SEEK, std::to_string(v))) {
            hub->Kick();
            Ok(res);
        }
    });
    server.Post("/api/player/repeat", [this](Req req, Res res) {
        Json::Value body;
        int mode = 0;
        if (!Body(req, res, &body))
            return;
        if (!body.isMember("mode")) {
            // Without a mode: the next one after the current (works on
            // renderers too, which only take a mode).
            Json::Value s;
            Json::CharReaderBuilder rb;
            std::unique_ptr<Json::CharReader> r(rb.newCharReader());
            std::string text = hub->Current();
            r->parse(text.data(), text.data() + text.size(), &s, nullptr);
            mode = s.get("repeat", 1).asInt() % 3 + 1;
        } else if (!IntField(body, "mode", 1, 3, &mode)) {
            return Error(res, 400, "mode: 1 normal, 2 repeat one, 3 repeat all");
        }
        if (Send(res, ACT_SET_REPEAT_MODE, std::to_string(mode))) {
            hub->Kick();
            Json::Value v(Json::objectValue);
            v["repeat"] = mode;
            Ok(res, v);
        }
    });

    // -- Queue -----------------------------------------------------------------
    server.Get("/api/queue", [](Req req, Res res) {
        int start = std::max(0, Param(req, "start", 0));
        int limit = std::min(64, std::max(1, Param(req, "limit", 50)));
        Json::Value r;
        std::string error;
        if (QueuePage(start, limit, &r, &error) != 0)
            return Error(res, 503, error);
        if (!r.isObject())
            return Error(res, 409, "no player is selected");
        Json::Value v(Json::objectValue);
        v["start"] = start;
        v["total"] = r.get("total", 0).asInt();
        v["current"] = r.get("current", 0).asInt();
        v["items"] = Json::Value(Json::arrayValue);
        for (const Json::Value &u : r["uris"])
            v["items"].append(QueueItem(u));
        Reply(res, v);
    });
    static const std::pair<const char *, int> byIndex[] = {
        {"play", ACT_PLAY_INDEX}, {"remove", ACT_QUEUE_REMOVE}};
    for (auto &q : byIndex) {
        int action = q.second;
        server.Post(std::string("/api/queue/") + q.first, [this, action](Req req, Res res) {
            Json::Value body;
            int index = 0;
            if (!Body(req, res, &body))
                return;
            if (!IntField(body, "index", 0, INT32_MAX, &index))
                return Error(res, 400, "index: a queue position from 0");
            if (Send(res, action, std::to_string(index))) {
                hub->Kick();
                Ok(res);
            }
        });
    }
    server.Post("/api/queue/clear", [this](Req, Res res) {
        if (Send(res, ACT_QUEUE_CLEAR, "")) {
            hub->Kick();
            Ok(res);
        }
    });
    // Moves an entry: removed, then inserted at its new place. "to": the
    // place it takes in the new order; "next": right after the current song.
    server.Post("/api/queue/move", [this](Req req, Res res) {
        Json::Value body, page;
        int from = 0, to = 0;
        std::string error;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "from", 0, INT32_MAX, &from))
            return Error(res, 400, "from: the queue position to move");
        if (QueuePage(from, 1, &page, &error) != 0)
            return Error(res, 503, error);
        int total = page.get("total", 0).asInt(), current = page.get("current", 0).asInt();
        if (!page["uris"].isArray() || page["uris"].empty() || from >= total)
            return Error(res, 404, "no queue entry " + std::to_string(from));
        if (body.get("next", false).asBool())
            to = current < from ? current + 1 : current;
        else if (!IntField(body, "to", 0, total - 1, &to))
            return Error(res, 400, "to: a queue position from 0 to " + std::to_string(total - 1));
        if (to == from)
            return Ok(res);
        TARN_MEDIA_INFO info = RecordFromItem(page["uris"][0]);
        if (!Send(res, ACT_QUEUE_REMOVE, std::to_string(from)))
            return;
        bool ok = to >= total - 1 ? SendRecord(res, ACT_QUEUE_ADD, info, 0)
                                  : SendRecord(res, ACT_QUEUE_INSERT, info, to);
        hub->Kick();
        if (ok)
            Ok(res);
    });

    // -- Library ---------------------------------------------------------------
    server.Get("/api/library/artists", [this](Req, Res res) {
        Json::Value v(Json::objectValue), list;
        std::string error;
        if (library->Artists(&list, &error) != 0)
            return Error(res, 503, error);
        v["artists"] = list;
        Reply(res, v);
    });
    server.Get("/api/library/albums", [this](Req req, Res res) {
        Json::Value v(Json::objectValue), list;
        std::string error;
        if (library->Albums(req.get_param_value("artist"), req.has_param("artist"), &list, &error) != 0)
            return Error(res, 503, error);
        v["albums"] = list;
        Reply(res, v);
    });
    server.Get("/api/library/songs", [this](Req req, Res res) {
        Json::Value v(Json::objectValue);
        std::string error;
        if (library->Songs(req.get_param_value("artist"), req.has_param("artist"), req.get_param_value("album"),
                           req.has_param("album"), Param(req, "start", 0), Param(req, "limit", 200), &v,
                           &error) != 0)
            return Error(res, 503, error);
        Reply(res, v);
    });
    server.Get("/api/library/search", [this](Req req, Res res) {
        Json::Value v(Json::objectValue);
        std::string error, q = req.get_param_value("q");
        if (q.empty())
            return Error(res, 400, "q: the text to look for");
        if (library->Search(q, req.get_param_value("field"), Param(req, "limit", 200), &v, &error) != 0)
            return Error(res, 503, error);
        Reply(res, v);
    });
    // Adds songs: {"ids":[...]} or every song of {"artist":..,"album":..};
    // "where": "end" (default), "next" (after the current song) or "play"
    // (after the current song, and play the first of them now).
    server.Post("/api/library/add", [this](Req req, Res res) {
        Json::Value body;
        std::string error;
        if (!Body(req, res, &body))
            return;
        std::vector<uint32_t> ids;
        if (body["ids"].isArray()) {
            for (const Json::Value &id : body["ids"])
                if (id.isNumeric() && id.asLargestInt() > 0 && id.asLargestInt() <= UINT32_MAX)
                    ids.push_back(static_cast<uint32_t>(id.asLargestUInt()));
        } else if (body.isMember("artist") || body.isMember("album")) {
            Json::Value list;
            if (library->Songs(body.get("artist", "").asString(), body.isMember("artist"),
                               body.get("album", "").asString(), body.isMember("album"), 0,
                               static_cast<int>(kMostSongsPerAdd), &list, &error) != 0)
                return Error(res, 503, error);
            for (const Json::Value &s : list["songs"])
                ids.push_back(s["id"].asUInt());
        }
        if (ids.empty() || ids.size() > kMostSongsPerAdd)
            return Error(res, 400, "ids: 1 to " + std::to_string(kMostSongsPerAdd) + " song ids of the library");
        std::vector<MediaSong> songs;
        if (library->SongsById(ids, &songs, &error) != 0)
            return Error(res, 503, error);
        if (songs.empty())
            return Error(res, 404, "none of these songs is in the library");
        std::string where = body.get("where", "end").asString();
        Json::Value page;
        if (QueuePage(0, 1, &page, &error) != 0)
            return Error(res, 503, error);
        int total = page.get("total", 0).asInt(), current = page.get("current", 0).asInt();
        int at = where == "end" || total == 0 ? total : current + 1;
        for (size_t i = 0; i < songs.size(); ++i) {
            TARN_MEDIA_INFO info;
            MediaSongToInfo(songs[i], &info);
            SetCover(&info);
            int pos = at + static_cast<int>(i);
            bool ok = pos >= total + static_cast<int>(i) ? SendRecord(res, ACT_QUEUE_ADD, info, 0)
                                                         : SendRecord(res, ACT_QUEUE_INSERT, info, pos);
            if (!ok) {
                hub->Kick();
                return;
            }
        }
        if (where == "play" && !Send(res, ACT_PLAY_INDEX, std::to_string(at)))
            return;
        hub->Kick();
        Json::Value v(Json::objectValue);
        v["added"] = static_cast<int>(songs.size());
        v["at"] = at;
        Ok(res, v);
    });
    server.Get("/api/library/scan", [this](Req, Res res) { Reply(res, library->ScanState()); });
    server.Post("/api/library/rescan", [this](Req, Res res) {
        // The folders of music_dir (separated by ':'), else the library's own.
        std::vector<std::string> folders;
        std::string dirs = ConfValue(options.confPath, "music_dir");
        for (size_t at = 0; at <= dirs.size();) {
            size_t end = dirs.find(':', at);
            if (end == std::string::npos)
                end = dirs.size();
            if (end > at)
                folders.push_back(dirs.substr(at, end - at));
            at = end + 1;
        }
        if (folders.empty() && !library->SongFolder().empty())
            folders.push_back(library->SongFolder());
        if (folders.empty())
            return Error(res, 409, "no music folder known: set music_dir in " + options.confPath);
        StatusHub *h = hub.get();
        if (library->StartScan(folders, [h](const Json::Value &state) { h->Publish("scan", Compact(state)); }) != 0)
            return Error(res, 409, "a scan is running already");
        Json::Value v(Json::objectValue);
        v["folder"] = folders[0];
        for (const std::string &f : folders)
            v["folders"].append(f);
        Ok(res, v);
    });

    // -- Sources -----------------------------------------------------------------
    server.Get("/api/sources", [](Req, Res res) {
        Json::Value v(Json::objectValue);
        v["slots"] = Json::Value(Json::arrayValue);
        for (int slot = 1; slot <= kCustomSlots; ++slot) {
            std::string type, second, third;
            Json::Value s(Json::objectValue);
            s["slot"] = slot;
            if (TARNAudioCustomGet(slot, type, second, third) == 0) {
                s["type"] = type;
                s["name"] = type == "smart" ? second : (third.empty() ? second : third);
            } else {
                s["type"] = "";
                s["name"] = "";
            }
            v["slots"].append(s);
        }
        std::vector<TARN_PLAYLIST_INFO> lists;
        v["playlists"] = Json::Value(Json::arrayValue);
        if (TARNPlaylistListAll(lists, 0, 0, 0) == 0)
            for (auto &p : lists) {
                Json::Value e(Json::objectValue);
                e["path"] = p.path;
                e["title"] = p.title;
                v["playlists"].append(e);
            }
        int total = 0;
        v["smart"] = Json::Value(Json::arrayValue);
        for (const std::string &name : MediaServer::SmartPLSEnum(0, 0, total, nullptr))
            v["smart"].append(name);
        Reply(res, v);
    });
    server.Post("/api/source", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        static const std::pair<const char *, int> kinds[] = {
            {"random", ACT_SOURCE_RANDOM},     {"radio", ACT_SOURCE_RADIO}, {"ipod", ACT_SOURCE_IPOD},
            {"playlist", ACT_SOURCE_PLAYLIST}, {"next", ACT_SOURCE_NEXT},   {"previous", ACT_SOURCE_PREVIOUS},
            {"custom", ACT_SOURCE_CUSTOM}};
        std::string kind = body.get("kind", "").asString();
        int action = 0, slot = 0;
        for (auto &k : kinds)
            if (kind == k.first)
                action = k.second;
        if (!action)
            return Error(res, 400, "kind: random, radio, ipod, playlist, next, previous or custom");
        if (action == ACT_SOURCE_CUSTOM && !IntField(body, "slot", 1, kCustomSlots, &slot))
            return Error(res, 400, "slot: 1 to " + std::to_string(kCustomSlots));
        // Fetching a radio list may take the daemon a while.
        if (Send(res, action, action == ACT_SOURCE_CUSTOM ? std::to_string(slot) : "", nullptr, 20000)) {
            hub->Kick();
            Ok(res);
        }
    });
    server.Post("/api/source/save", [this](Req req, Res res) {
        Json::Value body;
        int slot = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "slot", 1, kCustomSlots, &slot))
            return Error(res, 400, "slot: 1 to " + std::to_string(kCustomSlots));
        if (Send(res, ACT_SAVE_CUSTOM, std::to_string(slot)))
            Ok(res);
    });
    // Plays one saved ({"path":...}) or smart ({"smart":name}) playlist.
    server.Post("/api/source/list", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        std::vector<TARN_MEDIA_INFO> songs;
        if (body.isMember("path")) {
            int count = 0;
            std::string path = body["path"].asString();
            std::vector<TARN_PLAYLIST_INFO> lists;
            TARNPlaylistListAll(lists, 0, 0, 0);
            if (std::none_of(lists.begin(), lists.end(), [&](const TARN_PLAYLIST_INFO &p) { return p.path == path; }))
                return Error(res, 404, "no saved playlist " + path);
            if (ParsePlayListByFieldGivenPath(path.c_str(), &count, 0, 0, "*", 1, songs) != 0)
                return Error(res, 409, "the playlist has no playable song");
        } else {
            int total = 0;
            std::vector<std::string> names = MediaServer::SmartPLSEnum(0, 0, total, nullptr);
            auto it = std::find(names.begin(), names.end(), body.get("smart", "").asString());
            if (it == names.end())
                return Error(res, 404, "no smart playlist of that name");
            std::list<TARN_MEDIA_INFO> list;
            MediaServer::SmartPLSListSongs(static_cast<int>(it - names.begin()), 0, 0, total, list);
            songs.assign(list.begin(), list.end());
            if (songs.empty())
                return Error(res, 409, "no song matches the smart playlist");
        }
        if (songs.size() > kMostSongsPerAdd)
            songs.resize(kMostSongsPerAdd);
        if (!Send(res, ACT_QUEUE_CLEAR, ""))
            return;
        for (TARN_MEDIA_INFO &info : songs) {
            SetCover(&info);
            if (!SendRecord(res, ACT_QUEUE_ADD, info, 0)) {
                hub->Kick();
                return;
            }
        }
        if (Send(res, ACT_PLAY_INDEX, "0")) {
            hub->Kick();
            Ok(res);
        }
    });

    // -- Radio -------------------------------------------------------------------
    server.Get("/api/radio", [](Req req, Res res) {
        int type = ListType(req.get_param_value("list"));
        if (!type)
            return Error(res, 400, "list: favorite or userdef");
        Json::Value list;
        if (RadioListGet(type, list) != 0)
            return Error(res, 503, "the station list cannot be read");
        Json::Value v(Json::objectValue);
        v["stations"] = Json::Value(Json::arrayValue);
        for (const Json::Value &s : list["stations"]) {
            Json::Value e(Json::objectValue);
            e["name"] = s.get("name", "").asString();
            e["url"] = s.get("url", "").asString();
            e["desc"] = s.get("desc", "").asString();
            e["bitrate"] = s["bitrate"].isNumeric() ? s["bitrate"].asInt() : 0;
            v["stations"].append(e);
        }
        v["total"] = list.get("total", 0).asInt();
        Reply(res, v);
    });
    server.Post("/api/radio/play", [this](Req req, Res res) {
        Json::Value body, list;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        if (!type || !IntField(body, "index", 0, INT32_MAX, &index))
            return Error(res, 400, "list (favorite or userdef) and index of a station");
        if (RadioListGet(type, list) != 0 || index >= static_cast<int>(list["stations"].size()))
            return Error(res, 404, "no such station");
        const Json::Value &station = list["stations"][index];
        if (type == RADIO_LIST_FAVORITE && list.get("total", 0).asInt() != 0) {
            // The radio source plays the favourites: the whole list is
            // queued, so next and previous step through the stations.
            if (!Send(res, ACT_SOURCE_RADIO, "", nullptr, 20000))
                return;
            if (index > 0 && !Send(res, ACT_PLAY_INDEX, std::to_string(index)))
                return;
        } else {
            TARN_MEDIA_INFO info;
            memset(&info, 0, sizeof(info));
            snprintf(info.title, sizeof(info.title), "%s", station.get("name", "").asString().c_str());
            snprintf(info.path, sizeof(info.path), "%s", station.get("url", "").asString().c_str());
            if (!Send(res, ACT_QUEUE_CLEAR, "") || !SendRecord(res, ACT_QUEUE_ADD, info, 0) ||
                !Send(res, ACT_PLAY_INDEX, "0"))
                return;
        }
        hub->Kick();
        Ok(res);
    });
    server.Post("/api/radio/add", [](Req req, Res res) {
        std::lock_guard<std::mutex> lock(radioMutex);
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        std::string name = body.get("name", "").asString(), url = body.get("url", "").asString();
        if (!type || name.empty() || name.size() > 254 || !ValidStreamUrl(url))
            return Error(res, 400, "a station needs a name and an http(s) stream URL");
        Json::Value stations(Json::arrayValue), s(Json::objectValue);
        s["name"] = name;
        s["url"] = url;
        s["desc"] = body.get("desc", "").asString();
        stations.append(s);
        bool saved = false;
        if (RadioListAdd(type, stations, &saved) != 0 || !saved)
            return Error(res, 500, "the station list could not be saved");
        Ok(res);
    });
    server.Post("/api/radio/rename", [](Req req, Res res) {
        std::lock_guard<std::mutex> lock(radioMutex);
        Json::Value body, list;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        std::string name = body.get("name", "").asString();
        if (!type || !IntField(body, "index", 0, INT32_MAX, &index) || name.empty() || name.size() > 254)
            return Error(res, 400, "list, index and a new name");
        if (RadioListGet(type, list) != 0 || index >= static_cast<int>(list["stations"].size()))
            return Error(res, 404, "no such station");
        Json::Value s = list["stations"][index];
        s["name"] = name;
        if (!s.isMember("desc"))
            s["desc"] = "";
        if (body.isMember("url")) {
            if (!ValidStreamUrl(body["url"].asString()))
                return Error(res, 400, "url: an http(s) stream URL");
            s["url"] = body["url"].asString();
        }
        bool saved = false;
        if (RadioListEdit(type, static_cast<unsigned>(index), s, &saved) != 0 || !saved)
            return Error(res, 500, "the station list could not be saved");
        Ok(res);
    });
    server.Post("/api/radio/remove", [](Req req, Res res) {
        std::lock_guard<std::mutex> lock(radioMutex);
        Json::Value body, list;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        if (!type || !IntField(body, "index", 0, INT32_MAX, &index))
            return Error(res, 400, "list and index of a station");
        if (RadioListGet(type, list) != 0 || index >= static_cast<int>(list["stations"].size()))
            return Error(res, 404, "no such station");
        bool saved = false;
        if (RadioListDelete(type, std::to_string(index), &saved) != 0 || !saved)
            return Error(res, 500, "the station list could not be saved");
        Ok(res);
    });

    // -- Players -----------------------------------------------------------------
    server.Get("/api/players", [this](Req, Res res) {
        Json::Value r, status;
        std::string error;
        if (WebDaemonAction(ACT_LIST_RENDERERS, "0 0", &r, &error) != 0)
            return Error(res, 503, error);
        Json::Value v(Json::objectValue);
        v["renderers"] = Json::Value(Json::arrayValue);
        for (const Json::Value &e : r["list"]) {
            Json::Value p(Json::objectValue);
            p["index"] = e.get("index", 0).asInt();
            p["name"] = e.get("friendly_name", "").asString();
            p["address"] = e.get("ip", "").asString();
            v["renderers"].append(p);
        }
        Json::CharReaderBuilder rb;
        std::unique_ptr<Json::CharReader> reader(rb.newCharReader());
        std::string text = hub->Current();
        reader->parse(text.data(), text.data() + text.size(), &status, nullptr);
        v["selected"] = status["player"];
        Reply(res, v);
    });
    server.Post("/api/players/select", [this](Req req, Res res) {
        Json::Value body;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "index", -1, 4096, &index))
            return Error(res, 400, "index: -1 for this device, else a renderer's index");
        if (!Send(res, ACT_SELECT_PLAYER, std::to_string(index)))
            return;
        std::string text = hub->Current();
        Json::Value status;
        Json::CharReaderBuilder rb;
        std::unique_ptr<Json::CharReader> reader(rb.newCharReader());
        reader->parse(text.data(), text.data() + text.size(), &status, nullptr);
        if (status["player"].get("index", -2).asInt() != index)
            return Error(res, 404, "that renderer is no longer on the network");
        Ok(res);
    });
    server.Post("/api/players/refresh", [this](Req, Res res) {
        if (Send(res, ACT_SEARCH_RENDERERS, ""))
            Ok(res);
    });

    // -- Equalizer -----------------------------------------------------------------
    server.Get("/api/equalizer", [this](Req, Res res) {
        std::vector<EqProfile> profiles;
        ReadProfiles(TarnPath(kEqSystem), false, &profiles);
        ReadProfiles(TarnPath(kEqUser), true, &profiles);
        Json::Value v(Json::objectValue);
        v["profiles"] = Json::Value(Json::arrayValue);
        for (auto &p : profiles) {
            Json::Value e(Json::objectValue);
            e["name"] = p.name;
            e["gains"] = GainsJson(p.gains);
            e["user"] = p.user;
            v["profiles"].append(e);
        }
        v["enabled"] = ConfValue(options.confPath, "audio_enable_equalizer") == "yes";
        v["current"] = ConfValue(options.confPath, "audio_default_equalizer");
        Reply(res, v);
    });
    // {"name": profile} applies a profile and keeps it as the default;
    // {"gains": [10 numbers]} applies gains; {"enabled": false} goes flat.
    server.Post("/api/equalizer", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        float gains[10] = {0};
        std::string name;
        bool off = body.isMember("enabled") && !body["enabled"].asBool();
        if (body.isMember("name") && !off) {
            name = body["name"].asString();
            char text[1024];
            int found = EqProfileLookup(TarnPath(kEqSystem).c_str(), name.c_str(), text, sizeof(text));
            if (found == 0)
                found = EqProfileLookup(TarnPath(kEqUser).c_str(), name.c_str(), text, sizeof(text));
            if (found != 1 || name.empty())
                return Error(res, 404, "no equalizer profile " + name);
            Json::Value g = GainsJson(text);
            for (Json::ArrayIndex i = 0; i < g.size() && i < 10; ++i)
                gains[i] = g[i].asFloat();
        } else if (body["gains"].isArray() && !off) {
            if (body["gains"].size() != 10)
                return Error(res, 400, "gains: ten numbers from -12 to 12");
            for (int i = 0; i < 10; ++i) {
                const Json::Value &g = body["gains"][i];
                if (!g.isNumeric() || g.asDouble() < -12 || g.asDouble() > 12)
                    return Error(res, 400, "gains: ten numbers from -12 to 12");
                gains[i] = g.asFloat();
            }
        } else if (!off) {
            return Error(res, 400, "give a profile name, ten gains or enabled:false");
        }
        char text[256];
        CtrlFormatEqualizer(gains, text, sizeof(text));
        Json::Value status;
        std::string s = hub->Current();
        Json::CharReaderBuilder rb;
        std::unique_ptr<Json::CharReader> reader(rb.newCharReader());
        reader->parse(s.data(), s.data() + s.size(), &status, nullptr);
        if (status["player"].get("kind", "").asString() == "renderer")
            return Error(res, 409, "the equalizer works on this device's own output; select it first");
        if (!Send(res, ACT_SET_EQUALIZER, text))
            return;
        if (!name.empty() || off) {
            if (!name.empty() &&
                TLIBCFileSetKeyValue(options.confPath.c_str(), "audio_default_equalizer", name.c_str(),
                                     "%s=\"%s\"\n") != 0)
                return Error(res, 500, "the profile was applied but could not be kept in " + options.confPath);
            TLIBCFileSetKeyValue(options.confPath.c_str(), "audio_enable_equalizer", off ? "no" : "yes",
                                 "%s=\"%s\"\n");
        }
        Ok(res);
    });
}
