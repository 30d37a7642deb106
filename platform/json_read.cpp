#include "platform/json_read.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <memory>

namespace {

void SetErr(std::string *err, const std::string &text)
{
    if (err)
        *err = text;
}

// The deepest nesting of arrays and objects in text, strings skipped; stops
// counting once limit is passed.
int NestingDepth(const std::string &text, int limit)
{
    int depth = 0, deepest = 0;
    bool inString = false;
    for (size_t i = 0; i < text.size(); i++) {
        char c = text[i];
        if (inString) {
            if (c == '\\')
                i++;
            else if (c == '"')
                inString = false;
            continue;
        }
        if (c == '"') {
            inString = true;
        } else if (c == '[' || c == '{') {
            if (++depth > deepest)
                deepest = depth;
            if (deepest > limit)
                return deepest;
        } else if ((c == ']' || c == '}') && depth > 0) {
            depth--;
        }
    }
    return deepest;
}

}  // namespace

int JsonParseBounded(const std::string &text, size_t max_bytes, int max_depth,
                     Json::Value *out, std::string *err)
{
    *out = Json::Value();
    if (text.size() > max_bytes) {
        SetErr(err, "text of " + std::to_string(text.size()) + " bytes is over the limit of " +
                        std::to_string(max_bytes));
        return -1;
    }
    if (NestingDepth(text, max_depth) > max_depth) {
        SetErr(err, "nested deeper than " + std::to_string(max_depth) + " levels");
        return -1;
    }
    Json::CharReaderBuilder builder;
    builder["allowComments"] = true;
    builder["stackLimit"] = max_depth + 8;
    std::string errs;
    bool ok = false;
    try {
        std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
        ok = reader->parse(text.data(), text.data() + text.size(), out, &errs);
    } catch (const std::exception &e) {
        errs = e.what();
        ok = false;
    }
    if (!ok) {
        *out = Json::Value();
        while (!errs.empty() && (errs.back() == '\n' || errs.back() == ' '))
            errs.pop_back();
        SetErr(err, errs.empty() ? "not JSON" : errs);
        return -1;
    }
    return 0;
}

int JsonReadFileBounded(const std::string &path, size_t max_bytes, int max_depth,
                        Json::Value *out, std::string *err)
{
    *out = Json::Value();
    FILE *f = fopen(path.c_str(), "rb");
    if (!f) {
        SetErr(err, strerror(errno));
        return -1;
    }
    std::string text;
    char buffer[65536];
    size_t n;
    while ((n = fread(buffer, 1, sizeof(buffer), f)) > 0) {
        if (text.size() + n > max_bytes) {
            fclose(f);
            SetErr(err, "file is over the limit of " + std::to_string(max_bytes) + " bytes");
            return -1;
        }
        text.append(buffer, n);
    }
    bool failed = ferror(f) != 0;
    fclose(f);
    if (failed) {
        SetErr(err, "read error");
        return -1;
    }
    return JsonParseBounded(text, max_bytes, max_depth, out, err);
}
