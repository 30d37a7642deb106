#include "tools/tarnctl/text.h"

#include <climits>
#include <clocale>
#include <cstring>
#include <cwchar>
#include <cwctype>
#include <langinfo.h>
#include <vector>

namespace {

const char kReplacement[] = "\xEF\xBF\xBD";  // U+FFFD
const char kEllipsis[] = "\xE2\x80\xA6";     // U+2026, one column

// One decoded character: its bytes in the input and its code point (or -1
// for a byte that starts no valid character).
struct Char {
    size_t start, length;
    long code;
};

std::vector<Char> Decode(const std::string &text)
{
    std::vector<Char> out;
    mbstate_t st;
    memset(&st, 0, sizeof(st));
    size_t i = 0;
    while (i < text.size()) {
        wchar_t wc = 0;
        size_t n = mbrtowc(&wc, text.data() + i, text.size() - i, &st);
        if (n == static_cast<size_t>(-1) || n == static_cast<size_t>(-2) || n == 0) {
            // Invalid or cut short: this byte alone stands for U+FFFD.
            memset(&st, 0, sizeof(st));
            out.push_back({i, 1, n == 0 ? 0 : -1});
            i += 1;
            continue;
        }
        out.push_back({i, n, static_cast<long>(wc)});
        i += n;
    }
    return out;
}

bool IsControl(long code)
{
    return code < 0x20 || code == 0x7F || (code >= 0x80 && code < 0xA0);
}

int CharWidth(long code)
{
    if (code < 0 || IsControl(code))
        return 1;  // shown as U+FFFD
    int w = wcwidth(static_cast<wchar_t>(code));
    return w < 0 ? 1 : w;
}

}  // namespace

void TextInit()
{
    const char *set = setlocale(LC_CTYPE, "");
    bool utf8 = set && strcmp(nl_langinfo(CODESET), "UTF-8") == 0;
    if (!utf8 && !setlocale(LC_CTYPE, "C.UTF-8"))
        setlocale(LC_CTYPE, "C.utf8");
}

std::string TextClean(const std::string &text)
{
    std::string out;
    out.reserve(text.size());
    for (const Char &c : Decode(text)) {
        if (c.code < 0 || IsControl(c.code))
            out += kReplacement;
        else
            out.append(text, c.start, c.length);
    }
    return out;
}

int TextWidth(const std::string &text)
{
    int w = 0;
    for (const Char &c : Decode(text))
        w += CharWidth(c.code);
    return w;
}

std::string TextCut(const std::string &textIn, int columns)
{
    std::string text = TextClean(textIn);
    if (columns <= 0)
        return std::string();
    if (TextWidth(text) <= columns)
        return text;
    // Room for the ellipsis; a character is taken with the combining marks
    // that follow it (they take no column), or not at all.
    std::string out;
    int used = 0;
    for (const Char &c : Decode(text)) {
        int w = CharWidth(c.code);
        if (used + w > columns - 1)
            break;
        out.append(text, c.start, c.length);
        used += w;
    }
    return out + kEllipsis;
}

std::string TextFit(const std::string &text, int columns, bool right)
{
    std::string cut = TextCut(text, columns);
    int w = TextWidth(cut);
    std::string pad(static_cast<size_t>(columns > w ? columns - w : 0), ' ');
    return right ? pad + cut : cut + pad;
}

std::string TextFold(const std::string &textIn)
{
    std::string text = TextClean(textIn);
    std::string out;
    for (const Char &c : Decode(text)) {
        wchar_t low = static_cast<wchar_t>(towlower(static_cast<wint_t>(c.code)));
        char buf[MB_LEN_MAX];
        mbstate_t st;
        memset(&st, 0, sizeof(st));
        size_t n = wcrtomb(buf, low, &st);
        if (n == static_cast<size_t>(-1))
            out.append(text, c.start, c.length);
        else
            out.append(buf, n);
    }
    return out;
}
