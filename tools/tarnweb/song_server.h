// The song server: answers the audiotransfer.cgi URLs that the renderer
// player hands to renderers.
//
//   GET|HEAD /audio/webUI/audiotransfer.cgi/<token>.<ext>
//       <token> is the song-id token (platform/media_id.h); the song's file
//       is looked up in the media library by id.
//   GET|HEAD /audio/webUI/audiotransfer.cgi/ipod/<path token>.<ext>
//       <path token> names the file and is signed with the installation's
//       secret (MediaPathToken, platform/media_id.h): songs on USB volumes
//       and songs queued by path. Anything else gets 404.
//
// Files are streamed from disk in chunks, with byte ranges (206, and 416 for
// a range past the end), the type's MIME type and the DLNA streaming headers.
#ifndef TARNWEB_SONG_SERVER_H
#define TARNWEB_SONG_SERVER_H

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "tools/tarnweb/guarded_server.h"

class MediaLib;

struct SongServerOptions {
    std::string bindAddress = "0.0.0.0";
    int port = 0;              // 0: any free port
    int threads = 64;          // worker threads (requests served at once)
    int perClient = 16;        // connections of one client address at once
    int writeTimeoutSec = 60;  // a client that reads nothing for this long is dropped
    std::string dbPath;        // media library database
    bool verbose = false;      // one line per request on stderr
    std::string accessLog;     // file that gets one line per song request ("" none)
};

class SongServer {
public:
    explicit SongServer(const SongServerOptions &options);
    ~SongServer();
    SongServer(const SongServer &) = delete;
    SongServer &operator=(const SongServer &) = delete;

    // The HTTP server, for more routes before Bind().
    httplib::Server &Http() { return *server; }
    // Binds the listening socket; returns the port, or -1.
    int Bind();
    // Serves until Stop(); 0 when stopped, -1 on a listening error.
    int Serve();
    void Stop();

private:
    int LookupSong(uint32_t id, std::string *path);
    void ServeFile(const httplib::Request &req, httplib::Response &res, const std::string &path,
                   const std::string &urlExt);

    void LogAccess(const httplib::Request &req);

    SongServerOptions options;
    int accessFd = -1;
    std::unique_ptr<GuardedServer> server;
    std::mutex libraryMutex;
    std::unique_ptr<MediaLib> library;
};

#endif
