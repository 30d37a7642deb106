#include "platform/tlibc_conf.h"

#include "platform/tarn_env.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace {

bool IsBlank(char c)
{
    return c == ' ' || c == '\t' || c == '\r' || c == '\n' || c == '\v' || c == '\f';
}

std::string Trim(const std::string &s)
{
    size_t b = 0;
    size_t e = s.size();
    while (b < e && IsBlank(s[b]))
        ++b;
    while (e > b && IsBlank(s[e - 1]))
        --e;
    return s.substr(b, e - b);
}

// Splits a configuration line into key and value. False for lines without
// a setting (blank, comment, no '=').
bool ParseLine(const std::string &line, std::string &key, std::string &value)
{
    std::string t = Trim(line);
    if (t.empty() || t[0] == '#')
        return false;
    size_t eq = t.find('=');
    if (eq == std::string::npos)
        return false;
    key = Trim(t.substr(0, eq));
    value = Trim(t.substr(eq + 1));
    if (value.size() >= 2 && value.front() == '"' && value.back() == '"')
        value = value.substr(1, value.size() - 2);
    return true;
}

// Reads the whole file into lines (without their line ends). False when the
// file cannot be read; missing is set when it does not exist.
bool ReadLines(const char *file, std::vector<std::string> &lines, bool &missing)
{
    missing = false;
    FILE *fp = fopen(file, "r");
    if (!fp) {
        missing = (errno == ENOENT);
        return false;
    }
    std::string cur;
    char buf[4096];
    bool ok = true;
    for (;;) {
        size_t n = fread(buf, 1, sizeof(buf), fp);
        for (size_t i = 0; i < n; ++i) {
            if (buf[i] == '\n') {
                lines.push_back(cur);
                cur.clear();
            } else {
                cur += buf[i];
            }
        }
        if (n < sizeof(buf)) {
            if (ferror(fp))
                ok = false;
            break;
        }
    }
    if (!cur.empty())
        lines.push_back(cur);
    fclose(fp);
    return ok;
}

// True when fmt holds exactly two "%s" conversions and otherwise only "%%".
bool FormatIsSafe(const char *fmt)
{
    int strings = 0;
    for (const char *p = fmt; *p; ++p) {
        if (*p != '%')
            continue;
        if (p[1] == '%') {
            ++p;
        } else if (p[1] == 's') {
            ++strings;
            ++p;
        } else {
            return false;
        }
    }
    return strings == 2;
}

// Creates every missing directory above path (like "mkdir -p dirname").
int MakeParents(const std::string &path)
{
    size_t slash = path.rfind('/');
    if (slash == std::string::npos || slash == 0)
        return 0;
    std::string dir = path.substr(0, slash);
    struct stat st;
    if (stat(dir.c_str(), &st) == 0)
        return S_ISDIR(st.st_mode) ? 0 : -1;
    if (MakeParents(dir) != 0)
        return -1;
    if (mkdir(dir.c_str(), 0755) != 0 && errno != EEXIST)
        return -1;
    return 0;
}

int WriteAll(int fd, const std::string &data)
{
    size_t done = 0;
    while (done < data.size()) {
        ssize_t w = write(fd, data.data() + done, data.size() - done);
        if (w < 0) {
            if (errno == EINTR)
                continue;
            return -1;
        }
        done += static_cast<size_t>(w);
    }
    return 0;
}

// Replaces file with data: temporary file in the same directory, fsync,
// rename, then fsync of the directory so that the rename itself is durable.
int ReplaceFile(const std::string &file, const std::string &data, mode_t mode)
{
    std::string tmp = file + ".XXXXXX";
    std::vector<char> tmpl(tmp.begin(), tmp.end());
    tmpl.push_back('\0');
    int fd = mkstemp(tmpl.data());
    if (fd < 0)
        return -1;
    bool ok = fchmod(fd, mode) == 0 && WriteAll(fd, data) == 0 && fsync(fd) == 0;
    if (close(fd) != 0)
        ok = false;
    if (!ok || rename(tmpl.data(), file.c_str()) != 0) {
        int saved = errno;
        unlink(tmpl.data());
        errno = saved;
        return -1;
    }
    size_t slash = file.rfind('/');
    std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : file.substr(0, slash));
    int dfd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dfd >= 0) {
        fsync(dfd);
        close(dfd);
    }
    return 0;
}

}  // namespace

int TLIBCFileGetKeyValue(const char *file, const char *key, char *buffer, size_t size, int flags)
{
    (void)flags;
    if (!file || !key || !*key || !buffer || size == 0)
        return -1;
    buffer[0] = '\0';
    std::vector<std::string> lines;
    bool missing = false;
    if (!ReadLines(file, lines, missing))
        return -1;
    std::string k, v;
    for (const std::string &line : lines) {
        if (!ParseLine(line, k, v) || k != key)
            continue;
        snprintf(buffer, size, "%s", v.c_str());
        return static_cast<int>(strlen(buffer));
    }
    return 0;
}

int TLIBCFileSetKeyValue(const char *file, const char *key, const char *value,
                         const char *lineFormat)
{
    if (!file || !*file || !key || !*key || !value)
        return -1;
    if (strpbrk(key, "=\n\r") || strpbrk(value, "\n\r"))
        return -1;
    const char *fmt = lineFormat ? lineFormat : "%s=%s\n";
    if (!FormatIsSafe(fmt))
        return -1;

    std::vector<std::string> lines;
    bool missing = false;
    mode_t mode = 0644;
    if (!ReadLines(file, lines, missing)) {
        if (!missing)
            return -1;
        lines.clear();
        if (MakeParents(file) != 0)
            return -1;
    } else {
        struct stat st;
        if (stat(file, &st) == 0)
            mode = st.st_mode & 07777;
    }

    int n = snprintf(nullptr, 0, fmt, key, value);
    if (n < 0)
        return -1;
    std::vector<char> formatted(static_cast<size_t>(n) + 1);
    snprintf(formatted.data(), formatted.size(), fmt, key, value);
    std::string setting(formatted.data());
    if (setting.empty() || setting.back() != '\n')
        setting += '\n';

    std::string out;
    bool written = false;
    std::string k, v;
    for (const std::string &line : lines) {
        if (ParseLine(line, k, v) && k == key) {
            if (!written) {
                out += setting;
                written = true;
            }
            continue;
        }
        out += line;
        out += '\n';
    }
    if (!written)
        out += setting;
    return ReplaceFile(file, out, mode) == 0 ? 0 : -1;
}

int TLIBCStrTrimSpace(char *text, int flags)
{
    (void)flags;
    if (!text)
        return -1;
    size_t len = strlen(text);
    size_t b = 0;
    while (b < len && IsBlank(text[b]))
        ++b;
    size_t e = len;
    while (e > b && IsBlank(text[e - 1]))
        --e;
    size_t n = e - b;
    if (b > 0)
        memmove(text, text + b, n);
    text[n] = '\0';
    return static_cast<int>(n);
}

TLIBC_SZLIST *TLIBCSzListAlloc(int initialCapacity)
{
    if (initialCapacity < 1)
        initialCapacity = 1;
    TLIBC_SZLIST *list = static_cast<TLIBC_SZLIST *>(calloc(1, sizeof(TLIBC_SZLIST)));
    if (!list)
        return nullptr;
    list->items = static_cast<char **>(calloc(static_cast<size_t>(initialCapacity), sizeof(char *)));
    if (!list->items) {
        free(list);
        return nullptr;
    }
    list->capacity = initialCapacity;
    return list;
}

int TLIBCSzListAdd(TLIBC_SZLIST **list, const char *text)
{
    if (!list || !*list || !text)
        return -1;
    TLIBC_SZLIST *l = *list;
    if (l->count >= l->capacity) {
        int cap = l->capacity * 2;
        char **items = static_cast<char **>(realloc(l->items, static_cast<size_t>(cap) * sizeof(char *)));
        if (!items)
            return -1;
        l->items = items;
        l->capacity = cap;
    }
    char *copy = strdup(text);
    if (!copy)
        return -1;
    l->items[l->count++] = copy;
    return 0;
}

const char *TLIBCSzListGet(const TLIBC_SZLIST *list, int i)
{
    if (!list || i < 0 || i >= list->count)
        return nullptr;
    return list->items[i];
}

int TLIBCSzListCount(const TLIBC_SZLIST *list)
{
    return list ? list->count : 0;
}

int TLIBCSzListSortItems(TLIBC_SZLIST *list, int ascending)
{
    if (!list)
        return -1;
    std::stable_sort(list->items, list->items + list->count, [ascending](const char *a, const char *b) {
        int c = strcmp(a, b);
        return ascending ? c < 0 : c > 0;
    });
    return 0;
}

void TLIBCSzListFree(TLIBC_SZLIST *list)
{
    if (!list)
        return;
    for (int i = 0; i < list->count; ++i)
        free(list->items[i]);
    free(list->items);
    free(list);
}

int TLIBCStrSep(const char *text, const char *separators, TLIBC_SZLIST **list)
{
    if (!text || !separators || !list || !*list)
        return -1;
    int added = 0;
    const char *p = text;
    while (*p) {
        size_t n = strcspn(p, separators);
        if (n > 0) {
            std::string piece(p, n);
            if (TLIBCSzListAdd(list, piece.c_str()) != 0)
                return -1;
            ++added;
        }
        p += n;
        if (*p)
            ++p;
    }
    return added;
}

unsigned long TarnConfNumber(const char *key, unsigned long fallback)
{
    char value[32];
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), key, value, sizeof(value), 0) <= 0)
        return fallback;
    char *end = nullptr;
    long n = strtol(value, &end, 10);
    return n > 0 && end != value ? static_cast<unsigned long>(n) : fallback;
}
