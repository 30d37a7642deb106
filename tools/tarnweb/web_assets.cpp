// The page's static files: read once at start, kept in memory,
// answered with ETags and compressed by the server as text. index.html names its assets under
// /v/<version>/, where the version is a digest of all files, so everything
// but the page itself may be cached for good.
#include <dirent.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <httplib.h>
#include <openssl/evp.h>

#include <cstdio>
#include <fstream>
#include <sstream>

#include "platform/tarn_log.h"
#include "tools/tarnweb/web_remote.h"

namespace {

const char *TypeFor(const std::string &name)
{
    static const std::pair<const char *, const char *> types[] = {
        {".html", "text/html; charset=utf-8"},
        {".css", "text/css; charset=utf-8"},
        {".js", "text/javascript; charset=utf-8"},
        {".svg", "image/svg+xml"},
        {".png", "image/png"},
        {".webmanifest", "application/manifest+json"},
        {".json", "application/json"},
        {".ico", "image/x-icon"},
    };
    for (auto &t : types) {
        size_t n = strlen(t.first);
        if (name.size() > n && name.compare(name.size() - n, n, t.first) == 0)
            return t.second;
    }
    return nullptr;
}

std::string Hex(const unsigned char *d, size_t n)
{
    static const char digits[] = "0123456789abcdef";
    std::string out;
    for (size_t i = 0; i < n; ++i) {
        out += digits[d[i] >> 4];
        out += digits[d[i] & 15];
    }
    return out;
}

std::string Sha256Hex(const std::string &data)
{
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int n = 0;
    EVP_Digest(data.data(), data.size(), digest, &n, EVP_sha256(), nullptr);
    return Hex(digest, n);
}

}  // namespace

std::string WebDefaultWwwDir()
{
    char exe[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", exe, sizeof(exe) - 1);
    if (n <= 0)
        return "";
    exe[n] = '\0';
    std::string dir(exe);
    dir = dir.substr(0, dir.rfind('/'));
    return dir + "/../share/tarnweb/www";
}

int WebAssets::Load(const std::string &dir, std::string *why)
{
    DIR *d = opendir(dir.c_str());
    if (!d) {
        *why = "cannot read the page's folder " + dir + ": " + strerror(errno);
        return -1;
    }
    std::map<std::string, Asset> loaded;
    while (struct dirent *e = readdir(d)) {
        std::string name = e->d_name;
        const char *type = TypeFor(name);
        if (name[0] == '.' || !type)
            continue;
        std::ifstream in(dir + "/" + name, std::ios::binary);
        std::stringstream ss;
        ss << in.rdbuf();
        if (!in) {
            closedir(d);
            *why = "cannot read " + dir + "/" + name;
            return -1;
        }
        Asset a;
        a.body = ss.str();
        a.type = type;
        loaded[name] = a;
    }
    closedir(d);
    if (!loaded.count("index.html")) {
        *why = "no index.html in " + dir;
        return -1;
    }
    std::string all;
    for (auto &f : loaded)
        all += f.first + '\0' + f.second.body;
    version = Sha256Hex(all).substr(0, 12);
    for (auto &f : loaded) {
        Asset &a = f.second;
        if (f.first == "index.html" || f.first == "manifest.webmanifest") {
            // The page and the manifest name the assets by version.
            std::string out;
            size_t at = 0, hit;
            while ((hit = a.body.find("{{V}}", at)) != std::string::npos) {
                out += a.body.substr(at, hit - at) + version;
                at = hit + 5;
            }
            a.body = out + a.body.substr(at);
        }
        a.etag = "\"" + Sha256Hex(a.body).substr(0, 16) + "\"";
    }
    files.swap(loaded);
    return 0;
}

size_t WebAssets::TotalBytes() const
{
    size_t n = 0;
    for (auto &f : files)
        n += f.second.body.size();
    return n;
}

bool WebAssets::Serve(const std::string &name, bool immutable, const httplib::Request &req,
                      httplib::Response &res) const
{
    auto it = files.find(name);
    if (it == files.end())
        return false;
    const Asset &a = it->second;
    res.set_header("ETag", a.etag);
    res.set_header("Cache-Control", immutable ? "public, max-age=31536000, immutable" : "no-cache");
    res.set_header("Vary", "Accept-Encoding");
    if (req.get_header_value("If-None-Match") == a.etag) {
        res.status = 304;
        return true;
    }
    // The server compresses text types (gzip, or brotli where offered).
    res.set_content(a.body, a.type.c_str());
    return true;
}
