// The web remote: the page people use to play music (static files from the
// installed tree), its JSON API under /api/ and the live status stream.
//
// The API talks to the daemon only through the control socket, one request
// per connection; it reads the published status segment for live status and
// the media library (read-only) for browsing and search.
//
//   GET  /                       the page (files of the www folder)
//   GET  /v/<version>/<file>     the page's assets, cached for good
//   GET  /api/status             the selected player's status
//   GET  /api/events             the same, pushed (Server-Sent Events)
//   GET  /api/queue?start=&limit=
//   GET  /api/library/{artists,albums,songs,search,scan}
//   GET  /api/sources, /api/radio?list=, /api/players, /api/equalizer
//   GET  /api/cover/<id>         cover art of a library song
//   POST /api/...                every change (see web_api.cpp)
//
// Safety: state changes only by POST; requests whose Host is not an address
// or name of this machine, and changes whose Origin is not the server's own,
// are refused; "web_password" of the configuration protects /api/ (never the
// song URLs that renderers fetch).
#ifndef TARNWEB_WEB_REMOTE_H
#define TARNWEB_WEB_REMOTE_H

#include <sqlite3.h>

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"

namespace httplib {
class Server;
struct Request;
struct Response;
}
struct MediaSong;

struct WebRemoteOptions {
    std::string wwwDir;        // the page's files ("" -> WebDefaultWwwDir())
    std::string dbPath;        // media library database
    std::string confPath;      // /etc/tarninfo.conf (under TARN_ROOT)
    int maxStreams = 8;        // live status streams served at once
    int statusIntervalMs = 250;  // reading of the published segment while a page listens
};

// The www folder beside the program: <dir of the executable>/../share/tarnweb/www.
std::string WebDefaultWwwDir();

// ---------------------------------------------------------------------------
// One request to the daemon: connect, one ControlRequest, read the reply to
// its end. 0 and the parsed reply (null for "null"), or -1 with a reason a
// person understands in *error.
int WebDaemonRequest(const ControlRequest &request, Json::Value *reply, std::string *error,
                     int timeoutMs = 3000);
int WebDaemonAction(int action, const std::string &text, Json::Value *reply, std::string *error,
                    int timeoutMs = 3000);

// ---------------------------------------------------------------------------
// Static files, held in memory with an ETag each.
class WebAssets {
public:
    // Reads every file of dir. 0, or -1 with the reason in *why.
    int Load(const std::string &dir, std::string *why);
    const std::string &Version() const { return version; }
    // Answers a GET of name (e.g. "app.js"); false when there is no such file.
    bool Serve(const std::string &name, bool immutable, const httplib::Request &req,
               httplib::Response &res) const;
    size_t TotalBytes() const;

private:
    struct Asset {
        std::string body, type, etag;
    };
    std::map<std::string, Asset> files;
    std::string version;
};

// ---------------------------------------------------------------------------
// Host, Origin and password checks.
class WebGuard {
public:
    explicit WebGuard(const std::string &confPath);
    // Checks one request; false after filling res with the refusal.
    bool Allow(const httplib::Request &req, httplib::Response &res);
    bool PasswordSet();
    // Checks a password; true and the session cookie value on success.
    bool Login(const std::string &password, std::string *cookie);
    bool HasSession(const httplib::Request &req);
    // The names a Host header may carry besides addresses: localhost, this
    // machine's name (and name.local), and the "web_hosts" list.
    bool HostAllowed(const std::string &hostHeader);

private:
    void Reload();
    std::string confPath;
    std::mutex mutex;
    int64_t confStamp = -1;
    std::string passwordDigest;  // SHA-256 of web_password, "" when none
    std::vector<std::string> extraHosts;
    std::string session;         // session cookie value of this run
};

// ---------------------------------------------------------------------------
// Live status: the published segment read at most 4 times a second while a
// page listens, completed with the daemon's status reply and the current
// queue entry when something other than the position changes.
class StatusHub {
public:
    explicit StatusHub(int intervalMs);
    ~StatusHub();
    void Start();
    void Stop();
    // Builds a fresh status now (for GET /api/status). Returns its JSON text.
    std::string Current();
    // Asks for a full refresh soon (after an action changed something).
    void Kick();
    // Waits until the status differs from seq, an extra event newer than
    // extrasSeen comes or timeoutMs passes; the latest text and its sequence
    // number. False when stopping.
    bool Wait(uint64_t seq, uint64_t extrasSeen, int timeoutMs, std::string *text, uint64_t *newSeq);
    void Subscribe(int delta);
    int Subscribers() const { return subscribers.load(); }
    // Extra events (library scan progress) sent to every listener.
    void Publish(const std::string &event, const std::string &json);
    // Pending extra events after seq (returns the newest extra seq).
    uint64_t Extras(uint64_t after, std::vector<std::pair<std::string, std::string>> *out);

private:
    void Loop();
    void Refresh(bool full);
    int ReadSegment(PublishedStatusShm *out);

    int intervalMs;
    std::mutex mutex;
    std::condition_variable changed;   // listeners wait here
    std::condition_variable wake;      // the reader waits here
    std::thread reader;
    bool running = false;
    bool kicked = false;
    std::atomic<int> subscribers{0};
    std::mutex refreshMutex;
    const PublishedStatusShm *segment = nullptr;
    PublishedStatusShm last;
    bool haveLast = false;
    int64_t lastFullMs = 0;
    Json::Value extra;          // from the daemon's status reply and queue entry
    std::string text;           // latest status JSON
    uint64_t seq = 0;
    uint64_t extraSeq = 0;
    std::vector<std::pair<uint64_t, std::pair<std::string, std::string>>> extras;
};

// ---------------------------------------------------------------------------
// The media library, opened read-only for browsing, search and cover art;
// rescans run in a thread of their own with their own connection.
class LibraryView {
public:
    explicit LibraryView(const std::string &dbPath);
    ~LibraryView();
    int Artists(Json::Value *out, std::string *error);
    int Albums(const std::string &artist, bool byArtist, Json::Value *out, std::string *error);
    int Songs(const std::string &artist, bool byArtist, const std::string &album, bool byAlbum,
              int start, int limit, Json::Value *out, std::string *error);
    // field: any, artist, album, title.
    int Search(const std::string &query, const std::string &field, int limit, Json::Value *out,
               std::string *error);
    // Songs by id, in the order given; ids not found are skipped.
    int SongsById(const std::vector<uint32_t> &ids, std::vector<MediaSong> *out, std::string *error);
    int IdByPath(const std::string &path, uint32_t *id);
    // Cover art of a song: image bytes and type; 1 found, 0 none, -1 error.
    int Cover(uint32_t id, std::string *data, std::string *type, std::string *etag);

    // Rescan of folder in the background; -1 when one runs already.
    int StartScan(const std::vector<std::string> &folders, std::function<void(const Json::Value &)> progress);
    Json::Value ScanState();
    // The folders of the library: the common folder of its songs.
    std::string SongFolder();

private:
    int OpenLocked(std::string *error);
    std::string dbPath;
    std::mutex mutex;
    sqlite3 *db = nullptr;
    std::mutex scanMutex;
    std::thread scanner;
    bool scanning = false;
    Json::Value scanState;
};

// Embedded or folder cover art of an audio file; 1 found, 0 none.
int WebCoverForFile(const std::string &path, std::string *data, std::string *type);

// ---------------------------------------------------------------------------
class WebRemote {
public:
    explicit WebRemote(const WebRemoteOptions &options);
    ~WebRemote();
    // Loads the page's files; 0 or -1 with the reason in *why.
    int Init(std::string *why);
    // Adds the page, the API and the guard to server (before its catch-all).
    void Register(httplib::Server &server);
    void Stop();
    const WebAssets &Assets() const { return assets; }

private:
    void RegisterApi(httplib::Server &server);
    // Route groups of the JSON API, registered in this order by RegisterApi.
    void RegisterSessionApi(httplib::Server &server);
    void RegisterTransportApi(httplib::Server &server);
    void RegisterQueueApi(httplib::Server &server);
    void RegisterLibraryApi(httplib::Server &server);
    void RegisterLibraryChangeApi(httplib::Server &server);
    void RegisterSourceApi(httplib::Server &server);
    void RegisterSourceListApi(httplib::Server &server);
    void RegisterRadioApi(httplib::Server &server);
    void RegisterRadioEditApi(httplib::Server &server);
    void RegisterPlayersApi(httplib::Server &server);
    void RegisterEqualizerApi(httplib::Server &server);
    // Handlers too long to stand inline (web_api_library.cpp).
    int LibraryAddIds(const Json::Value &body, std::vector<uint32_t> *ids, std::string *error);
    void AddLibrarySongs(const httplib::Request &req, httplib::Response &res);
    void RescanLibrary(httplib::Response &res);
    WebRemoteOptions options;
    WebAssets assets;
    std::unique_ptr<WebGuard> guard;
    std::unique_ptr<StatusHub> hub;
    std::unique_ptr<LibraryView> library;
    std::atomic<int> streams{0};
    std::atomic<bool> stopping{false};
};

#endif
