#include "tools/tarnweb/song_server.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <httplib.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/media_id.h"
#include "platform/medialib.h"
#include "platform/tarn_log.h"
#include "platform/tarn_media_types.h"
#include "tools/tarnweb/guarded_server.h"

static const char kLogUnit[] = "tarnweb";

namespace {

const size_t kChunk = 64 * 1024;
const size_t kMaxRanges = 8;
const int kBacklog = 1024;  // connections waiting to be accepted
// DLNA: streaming transfer, background transfer, connection stalling, DLNA 1.5.
const char kDlnaFlags[] = "DLNA.ORG_OP=01;DLNA.ORG_CI=0;DLNA.ORG_FLAGS=01700000000000000000000000000000";

// An open file, closed with the last response that streams it.
struct OpenFile {
    explicit OpenFile(int descriptor) : fd(descriptor) {}
    ~OpenFile()
    {
        if (fd >= 0)
            close(fd);
    }
    OpenFile(const OpenFile &) = delete;
    OpenFile &operator=(const OpenFile &) = delete;
    int fd;
};

// Splits "<name>.<ext>" at the last dot; false when there is none.
bool SplitName(const std::string &file, std::string *name, std::string *ext)
{
    size_t dot = file.rfind('.');
    if (dot == std::string::npos || dot == 0 || dot + 1 == file.size())
        return false;
    *name = file.substr(0, dot);
    *ext = file.substr(dot + 1);
    return true;
}

std::string MimeFor(const std::string &path, const std::string &urlExt)
{
    char mime[64];
    const char *ext = TARNIndexExtGet(path.c_str());
    if (ext && TARNAudioGetMimetype(ext, mime, sizeof(mime)) == 0)
        return mime;
    if (TARNAudioGetMimetype(urlExt.c_str(), mime, sizeof(mime)) == 0)
        return mime;
    return "application/octet-stream";
}

// Turns the parsed Range header into absolute, clamped ranges.
// Returns false when no range can be satisfied (416).
bool NormalizeRanges(httplib::Ranges &ranges, uint64_t size)
{
    if (ranges.empty())
        return true;
    httplib::Ranges good;
    for (const httplib::Range &r : ranges) {
        int64_t first = r.first, last = r.second;
        if (first < 0 && last < 0)
            continue;
        if (first < 0) {  // suffix: the last `last` bytes
            if (last == 0)
                continue;
            first = static_cast<int64_t>(size) > last ? static_cast<int64_t>(size) - last : 0;
            last = static_cast<int64_t>(size) - 1;
        } else {
            if (static_cast<uint64_t>(first) >= size)
                continue;
            if (last < 0 || static_cast<uint64_t>(last) >= size)
                last = static_cast<int64_t>(size) - 1;
            if (last < first)
                continue;
        }
        good.emplace_back(first, last);
    }
    if (good.empty())
        return false;
    // Overlapping and touching ranges are sent once: a request for the same
    // bytes many times over gets them once.
    std::sort(good.begin(), good.end());
    httplib::Ranges merged;
    for (const httplib::Range &r : good) {
        if (!merged.empty() && r.first <= merged.back().second + 1)
            merged.back().second = std::max(merged.back().second, r.second);
        else
            merged.push_back(r);
    }
    // Too many pieces, or the whole file anyway: answer with the whole file.
    if (merged.size() > kMaxRanges ||
        (merged.size() == 1 && merged[0].first == 0 &&
         static_cast<uint64_t>(merged[0].second) + 1 == size && ranges.size() > 1))
        merged.clear();
    ranges = merged;
    return true;
}

// An error answer. The Range header is dropped first: the library would
// otherwise cut the error text by it.
void ErrorReply(const httplib::Request &req, httplib::Response &res, int status, const char *text)
{
    const_cast<httplib::Request &>(req).ranges.clear();
    res.status = status;
    res.set_content(text, "text/plain");
}

void NotFound(const httplib::Request &req, httplib::Response &res)
{
    ErrorReply(req, res, 404, "Not Found\n");
}

}  // namespace

namespace {

GuardLimits LimitsOf(const SongServerOptions &options)
{
    GuardLimits limits;
    limits.workers = options.threads;
    limits.perClient = options.perClient;
    return limits;
}

}  // namespace

SongServer::SongServer(const SongServerOptions &opts)
    : options(opts), server(new GuardedServer(LimitsOf(opts)))
{
    if (options.dbPath.empty())
        options.dbPath = MediaLibDefaultPath();
    if (options.threads < 1)
        options.threads = 1;
    server->set_write_timeout(options.writeTimeoutSec, 0);
    server->set_read_timeout(10, 0);
    server->set_keep_alive_timeout(5);
    server->set_payload_max_length(64 * 1024);

    if (!options.accessLog.empty()) {
        accessFd = open(options.accessLog.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        if (accessFd < 0)
            TLOG("Cannot open the access log %s, %m", options.accessLog.c_str());
    }
    auto serve = [this](const httplib::Request &req, httplib::Response &res, bool usb) {
        LogAccess(req);
        std::string file = req.matches[1];
        std::string name, ext, path;
        if (!SplitName(file, &name, &ext)) {
            TLOG("Bad song name [%s] from %s", file.c_str(), req.remote_addr.c_str());
            NotFound(req, res);
            return;
        }
        if (usb) {
            // Only a path token made with this installation's secret names
            // a file: a bare hex path, or one whose signature does not match,
            // gets nothing.
            if (MediaPathTokenDecode(name.c_str(), &path) != 0) {
                TLOG("Bad path token [%.200s] from %s", name.c_str(), req.remote_addr.c_str());
                NotFound(req, res);
                return;
            }
        } else {
            uint32_t id = 0;
            if (MediaIDDecryption(name.c_str(), &id) != 0) {
                TLOG("Bad song token [%s] from %s", name.c_str(), req.remote_addr.c_str());
                NotFound(req, res);
                return;
            }
            int found = LookupSong(id, &path);
            if (found != 1) {
                TLOG("Song [%u] %s from %s", id, found == 0 ? "not in the library" : "lookup failed",
                     req.remote_addr.c_str());
                if (found < 0) {
                    ErrorReply(req, res, 503, "Media library not available\n");
                } else {
                    NotFound(req, res);
                }
                return;
            }
        }
        ServeFile(req, res, path, ext);
    };
    server->Get(R"(/audio/webUI/audiotransfer\.cgi/ipod/([^/]+))",
                [serve](const httplib::Request &req, httplib::Response &res) { serve(req, res, true); });
    server->Get(R"(/audio/webUI/audiotransfer\.cgi/([^/]+))",
                [serve](const httplib::Request &req, httplib::Response &res) { serve(req, res, false); });
    if (options.verbose) {
        server->set_logger([](const httplib::Request &req, const httplib::Response &res) {
            fprintf(stderr, "tarnweb: %s %s %s -> %d\n", req.remote_addr.c_str(), req.method.c_str(),
                    req.path.c_str(), res.status);
        });
    }
}

SongServer::~SongServer()
{
    if (accessFd >= 0)
        close(accessFd);
}

// "<address> <method> <path> <range>" as the request starts, one write per
// line so that lines of parallel requests never mix.
void SongServer::LogAccess(const httplib::Request &req)
{
    if (accessFd < 0)
        return;
    std::string line = req.remote_addr + " " + req.method + " " + req.path + " " +
                       (req.has_header("Range") ? req.get_header_value("Range") : "-") + "\n";
    if (write(accessFd, line.data(), line.size()) < 0) {
        // A full disk must not stop the songs.
    }
}

int SongServer::LookupSong(uint32_t id, std::string *path)
{
    std::lock_guard<std::mutex> lock(libraryMutex);
    if (!library) {
        std::unique_ptr<MediaLib> lib(new MediaLib);
        if (lib->Open(options.dbPath, false) != 0) {
            TLOG("Cannot open the media library %s: %s", options.dbPath.c_str(),
                 lib->LastError().c_str());
            return -1;
        }
        library = std::move(lib);
    }
    MediaSong song;
    int r = library->FindById(id, &song);
    if (r < 0) {
        TLOG("Media library lookup of song [%u] failed: %s", id, library->LastError().c_str());
        library.reset();  // opened again on the next request
        return -1;
    }
    if (r == 1)
        *path = song.path;
    return r;
}

void SongServer::ServeFile(const httplib::Request &req, httplib::Response &res,
                           const std::string &path, const std::string &urlExt)
{
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        TLOG("Cannot open [%s], %m", path.c_str());
        NotFound(req, res);
        return;
    }
    auto file = std::make_shared<OpenFile>(fd);
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        TLOG("Not a regular file [%s]", path.c_str());
        NotFound(req, res);
        return;
    }
    uint64_t size = static_cast<uint64_t>(st.st_size);
    std::string mime = MimeFor(path, urlExt);
    std::string features;
    if (mime == "audio/mpeg" && (urlExt == "mp3" || urlExt == "MP3"))
        features = "DLNA.ORG_PN=MP3;";
    features += kDlnaFlags;
    res.set_header("Accept-Ranges", "bytes");
    res.set_header("transferMode.dlna.org", "Streaming");
    res.set_header("contentFeatures.dlna.org", features);

    // The parsed ranges are clamped here so that the library computes the
    // Content-Range and lengths from valid numbers.
    httplib::Ranges &ranges = const_cast<httplib::Request &>(req).ranges;
    if (size == 0 || !NormalizeRanges(ranges, size)) {
        if (size == 0 && ranges.empty()) {
            res.set_content("", mime);
            return;
        }
        ranges.clear();
        res.status = 416;
        res.set_header("Content-Range", "bytes */" + std::to_string(size));
        return;
    }
    res.set_content_provider(
        static_cast<size_t>(size), mime,
        [file](size_t offset, size_t length, httplib::DataSink &sink) {
            char buffer[kChunk];
            size_t want = std::min(length, sizeof(buffer));
            ssize_t got = pread(file->fd, buffer, want, static_cast<off_t>(offset));
            if (got <= 0)
                return false;  // file shrank or failed: end the connection
            return sink.write(buffer, static_cast<size_t>(got));
        });
}

int SongServer::Bind()
{
    // Last: routes added by others (the web remote) come before it.
    server->Get(R"(.*)", [](const httplib::Request &req, httplib::Response &res) {
        TLOG("No such resource [%.200s] from %s", req.path.c_str(), req.remote_addr.c_str());
        NotFound(req, res);
    });
    int port = options.port;
    if (port == 0)
        port = server->bind_to_any_port(options.bindAddress);
    else if (!server->bind_to_port(options.bindAddress, port))
        port = -1;
    if (port > 0)
        server->SetBacklog(kBacklog);
    return port;
}

int SongServer::Serve()
{
    return server->listen_after_bind() ? 0 : -1;
}

void SongServer::Stop()
{
    server->stop();
}
