// Who may use the remote: requests must name this machine in their Host
// header (an address, localhost, the machine's name or a name of the
// "web_hosts" list), so a page of another site that rebinds its DNS name to
// this address gets nothing; changes must come from the server's own origin;
// and when "web_password" is set the API needs a session cookie (given by
// POST /api/login) or the password by HTTP Basic authentication.
#include <arpa/inet.h>
#include <sys/stat.h>
#include <unistd.h>

#include <httplib.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/rand.h>

#include <algorithm>
#include <cstring>

#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "tools/tarnweb/guarded_server.h"
#include "tools/tarnweb/web_remote.h"

static const char kLogUnit[] = "tarnweb";

namespace {

const char kCookie[] = "tarnweb_session";

std::string Lower(std::string s)
{
    std::transform(s.begin(), s.end(), s.begin(), [](unsigned char c) { return tolower(c); });
    return s;
}

std::string Digest(const std::string &text)
{
    unsigned char d[EVP_MAX_MD_SIZE];
    unsigned int n = 0;
    EVP_Digest(text.data(), text.size(), d, &n, EVP_sha256(), nullptr);
    return std::string(reinterpret_cast<char *>(d), n);
}

bool SameBytes(const std::string &a, const std::string &b)
{
    return a.size() == b.size() && CRYPTO_memcmp(a.data(), b.data(), a.size()) == 0;
}

// The host part of a Host header ("name:port", "[v6]:port").
std::string HostName(const std::string &header)
{
    if (!header.empty() && header[0] == '[') {
        size_t end = header.find(']');
        return end == std::string::npos ? "" : header.substr(1, end - 1);
    }
    return header.substr(0, header.find(':'));
}

bool IsAddress(const std::string &host)
{
    unsigned char buf[16];
    return inet_pton(AF_INET, host.c_str(), buf) == 1 || inet_pton(AF_INET6, host.c_str(), buf) == 1;
}

std::string Base64Decode(const std::string &in)
{
    std::string out;
    out.resize(in.size());
    int n = EVP_DecodeBlock(reinterpret_cast<unsigned char *>(&out[0]),
                            reinterpret_cast<const unsigned char *>(in.data()), static_cast<int>(in.size()));
    if (n < 0)
        return "";
    out.resize(static_cast<size_t>(n));
    // EVP_DecodeBlock counts the padding as zero bytes.
    size_t pad = 0;
    for (size_t i = in.size(); i > 0 && in[i - 1] == '='; --i)
        ++pad;
    out.resize(out.size() >= pad ? out.size() - pad : 0);
    return out;
}

// Refused before its body is read: the body stays in the connection, which
// therefore closes after the answer.
void Refuse(const httplib::Request &req, httplib::Response &res, int status, const std::string &why)
{
    std::string length = req.get_header_value("Content-Length");
    if ((!length.empty() && length != "0") || req.has_header("Transfer-Encoding")) {
        res.set_header("Connection", "close");
        GuardedServer::CloseAfterResponse();
    }
    Json::Value v;
    v["error"] = why;
    if (status == 401)
        v["login"] = true;
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    res.status = status;
    res.set_content(Json::writeString(b, v), "application/json");
}

}  // namespace

WebGuard::WebGuard(const std::string &conf) : confPath(conf)
{
    unsigned char r[32];
    if (RAND_bytes(r, sizeof(r)) != 1) {
        TLOG("No random bytes for the session key");
        for (unsigned char &c : r)
            c = static_cast<unsigned char>(rand());
    }
    static const char digits[] = "0123456789abcdef";
    for (unsigned char c : r) {
        session += digits[c >> 4];
        session += digits[c & 15];
    }
}

void WebGuard::Reload()
{
    struct stat st;
    int64_t stamp = stat(confPath.c_str(), &st) == 0
                        ? static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec + st.st_size
                        : 0;
    if (stamp == confStamp)
        return;
    confStamp = stamp;
    char value[1024] = "";
    passwordDigest.clear();
    if (TLIBCFileGetKeyValue(confPath.c_str(), "web_password", value, sizeof(value), 0) > 0)
        passwordDigest = Digest(value);
    extraHosts.clear();
    value[0] = '\0';
    if (TLIBCFileGetKeyValue(confPath.c_str(), "web_hosts", value, sizeof(value), 0) > 0) {
        std::string list = value;
        size_t at = 0;
        while (at <= list.size()) {
            size_t end = list.find_first_of(", ", at);
            if (end == std::string::npos)
                end = list.size();
            if (end > at)
                extraHosts.push_back(Lower(list.substr(at, end - at)));
            at = end + 1;
        }
    }
}

bool WebGuard::PasswordSet()
{
    std::lock_guard<std::mutex> lock(mutex);
    Reload();
    return !passwordDigest.empty();
}

bool WebGuard::Login(const std::string &password, std::string *cookie)
{
    std::lock_guard<std::mutex> lock(mutex);
    Reload();
    if (passwordDigest.empty() || SameBytes(Digest(password), passwordDigest)) {
        *cookie = session;
        return true;
    }
    return false;
}

bool WebGuard::HasSession(const httplib::Request &req)
{
    std::string cookies = req.get_header_value("Cookie");
    std::string want = std::string(kCookie) + "=";
    size_t at = 0;
    while ((at = cookies.find(want, at)) != std::string::npos) {
        if (at == 0 || cookies[at - 1] == ' ' || cookies[at - 1] == ';') {
            std::string value = cookies.substr(at + want.size());
            value = value.substr(0, value.find(';'));
            std::lock_guard<std::mutex> lock(mutex);
            if (SameBytes(value, session))
                return true;
        }
        at += want.size();
    }
    std::string auth = req.get_header_value("Authorization");
    if (auth.compare(0, 6, "Basic ") == 0) {
        std::string pair = Base64Decode(auth.substr(6));
        size_t colon = pair.find(':');
        std::lock_guard<std::mutex> lock(mutex);
        if (colon != std::string::npos && !passwordDigest.empty() &&
            SameBytes(Digest(pair.substr(colon + 1)), passwordDigest))
            return true;
    }
    return false;
}

bool WebGuard::HostAllowed(const std::string &header)
{
    std::string host = Lower(HostName(header));
    if (host.empty())
        return false;
    if (!host.empty() && host.back() == '.')
        host.pop_back();
    if (IsAddress(host) || host == "localhost" ||
        (host.size() > 10 && host.compare(host.size() - 10, 10, ".localhost") == 0))
        return true;
    char name[256] = "";
    if (gethostname(name, sizeof(name) - 1) == 0 && name[0]) {
        std::string mine = Lower(name);
        if (host == mine || host == mine + ".local" || host == mine.substr(0, mine.find('.')))
            return true;
    }
    std::lock_guard<std::mutex> lock(mutex);
    Reload();
    return std::find(extraHosts.begin(), extraHosts.end(), host) != extraHosts.end();
}

bool WebGuard::Allow(const httplib::Request &req, httplib::Response &res)
{
    res.set_header("X-Content-Type-Options", "nosniff");
    res.set_header("Referrer-Policy", "same-origin");
    std::string host = req.get_header_value("Host");
    if (!HostAllowed(host)) {
        TLOG("Refused %s %.200s: Host [%.100s] is not this server", req.method.c_str(), req.path.c_str(),
             host.c_str());
        Refuse(req, res, 403, "this server does not answer to the name " + host +
                             " (add it to web_hosts in the configuration)");
        return false;
    }
    bool change = req.method != "GET" && req.method != "HEAD";
    std::string origin = req.get_header_value("Origin");
    std::string site = req.get_header_value("Sec-Fetch-Site");
    bool sameOrigin = true;
    if (!origin.empty()) {
        std::string o = Lower(origin);
        sameOrigin = o == "http://" + Lower(host) || o == "https://" + Lower(host);
    } else if (!site.empty()) {
        sameOrigin = site == "same-origin" || site == "none";
    }
    bool api = req.path.compare(0, 5, "/api/") == 0;
    if ((change || api) && !sameOrigin) {
        TLOG("Refused cross-site %s %.200s from origin [%.100s]", req.method.c_str(), req.path.c_str(),
             origin.empty() ? site.c_str() : origin.c_str());
        Refuse(req, res, 403, "cross-site request refused");
        return false;
    }
    if (change) {
        // Forms of other pages cannot send JSON: every change carries it.
        // (Checked before the body is read: by its headers.)
        std::string type = req.get_header_value("Content-Type");
        std::string length = req.get_header_value("Content-Length");
        bool body = (!length.empty() && length != "0") || req.has_header("Transfer-Encoding");
        if (body && type.compare(0, 16, "application/json") != 0) {
            Refuse(req, res, 415, "changes are sent as application/json");
            return false;
        }
    }
    if (api && req.path != "/api/login" && req.path != "/api/session" && PasswordSet() && !HasSession(req)) {
        Refuse(req, res, 401, "password needed");
        return false;
    }
    return true;
}
