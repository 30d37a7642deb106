// The remote's routes: the page, the JSON API and the live status stream.
// Reads are GET; every change is a POST with a JSON body (or none) and is
// answered {"ok":true,...} or, with a non-2xx status, {"error":"..."}
// carrying what the daemon, the library or the radio lists reported.//
// This file: the shared helpers, the page, and the session and status
// routes; the player, queue, device and equalizer routes are in
// web_api_player.cpp, the library and source routes in web_api_library.cpp,
// the radio routes in web_api_radio.cpp.
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
#include "tools/tarnweb/web_api_util.h"

static const char kLogUnit[] = "tarnweb";

namespace webapi {

std::mutex radioMutex;

std::string Compact(const Json::Value &v)
{
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    b["emitUTF8"] = true;
    return Json::writeString(b, v);
}

void Reply(httplib::Response &res, const Json::Value &v, int status)
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

void Ok(httplib::Response &res, const Json::Value &extra)
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
bool Send(httplib::Response &res, int action, const std::string &text, Json::Value *reply,
          int timeoutMs)
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

}  // namespace webapi

using namespace webapi;

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
    RegisterSessionApi(server);
    RegisterTransportApi(server);
    RegisterQueueApi(server);
    RegisterLibraryApi(server);
    RegisterLibraryChangeApi(server);
    RegisterSourceApi(server);
    RegisterSourceListApi(server);
    RegisterRadioApi(server);
    RegisterRadioEditApi(server);
    RegisterPlayersApi(server);
    RegisterEqualizerApi(server);
}

void WebRemote::RegisterSessionApi(httplib::Server &server)
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
}
