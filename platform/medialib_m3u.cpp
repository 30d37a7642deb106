// The media library's M3U/M3U8 reader.
#include "platform/medialib.h"

#include <filesystem>
#include <fstream>

#include "platform/medialib_internal.h"

namespace fs = std::filesystem;
using namespace medialib_internal;

static std::string UrlDecode(const std::string &s)
{
    std::string out;
    for (size_t i = 0; i < s.size(); i++) {
        if (s[i] == '%' && i + 2 < s.size() && isxdigit((unsigned char)s[i + 1]) &&
            isxdigit((unsigned char)s[i + 2])) {
            out += (char)strtol(s.substr(i + 1, 2).c_str(), nullptr, 16);
            i += 2;
        } else {
            out += s[i];
        }
    }
    return out;
}

std::string medialib_internal::Trim(const std::string &s)
{
    size_t b = s.find_first_not_of(" \t\r\n");
    if (b == std::string::npos)
        return std::string();
    size_t e = s.find_last_not_of(" \t\r\n");
    return s.substr(b, e - b + 1);
}

int M3uRead(const std::string &path, std::string *title, std::vector<M3uEntry> *entries)
{
    std::ifstream in(path, std::ios::binary);
    if (!in)
        return -1;
    entries->clear();
    *title = fs::path(path).stem().string();
    std::string dir = fs::path(path).parent_path().string();
    std::string line, extTitle;
    bool first = true;
    int lines = 0;
    while (std::getline(in, line) && lines++ < 1000000) {
        if (first && line.compare(0, 3, "\xEF\xBB\xBF") == 0)
            line.erase(0, 3);
        first = false;
        line = Trim(line);
        if (line.empty())
            continue;
        if (line[0] == '#') {
            if (line.compare(0, 10, "#PLAYLIST:") == 0) {
                std::string t = Trim(line.substr(10));
                if (!t.empty() && ValidUtf8(t))
                    *title = t;
            } else if (line.compare(0, 8, "#EXTINF:") == 0) {
                size_t comma = line.find(',');
                extTitle = comma == std::string::npos ? std::string() : Trim(line.substr(comma + 1));
                if (!ValidUtf8(extTitle))
                    extTitle.clear();
            }
            continue;
        }
        std::string p = line;
        if (p.compare(0, 7, "file://") == 0)
            p = UrlDecode(p.substr(7));
        else if (p.find("://") != std::string::npos) {
            extTitle.clear();
            continue;  // streams are not songs of the library
        }
        std::replace(p.begin(), p.end(), '\\', '/');
        fs::path fp(p);
        if (fp.is_relative())
            fp = fs::path(dir) / fp;
        M3uEntry e;
        e.path = fp.lexically_normal().string();
        e.title = extTitle;
        extTitle.clear();
        entries->push_back(e);
    }
    return 0;
}
