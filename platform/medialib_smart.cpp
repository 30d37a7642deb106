// The media library's smart rules: the rule grammar, and the smart playlists
// kept in the store with the songs that match them.
#include "platform/medialib.h"

#include <cstdlib>
#include <cstring>

#include "platform/medialib_internal.h"
#include "platform/tarn_log.h"

using namespace medialib_internal;

static const char kLogUnit[] = "medialib";

struct FieldDef {
    const char *name;
    const char *column;
    bool numeric;
};
static const FieldDef kFields[] = {
    {"title", "title", false},     {"album", "album", false},     {"artist", "artist", false},
    {"genre", "genre", false},     {"path", "path", false},       {"year", "year", true},
    {"track", "track", true},      {"disc", "disc", true},        {"duration", "duration", true},
    {"bitrate", "bitrate", true},
};

static const FieldDef *FindField(const std::string &name)
{
    for (const FieldDef &f : kFields)
        if (name == f.name)
            return &f;
    return nullptr;
}

static bool IsNumber(const std::string &s)
{
    if (s.empty())
        return false;
    char *end = nullptr;
    errno = 0;
    strtod(s.c_str(), &end);
    return errno == 0 && end && *end == '\0';
}

static int CheckRule(const SmartRule &r, std::string *why)
{
    const FieldDef *f = FindField(r.field);
    if (!f) {
        *why = "unknown field \"" + r.field +
               "\" (use title, album, artist, genre, path, year, track, disc, duration, bitrate)";
        return -1;
    }
    static const char *const kOps[] = {"is", "isnot", "contains", "startswith", "from", "above", "below"};
    bool known = false;
    for (const char *o : kOps)
        known = known || r.op == o;
    if (!known) {
        *why = "unknown operator \"" + r.op + "\" (use is, isnot, contains, startswith, from A to B, above, below)";
        return -1;
    }
    if ((r.op == "from" || r.op == "above" || r.op == "below") && !f->numeric) {
        *why = "operator \"" + r.op + "\" needs a numeric field";
        return -1;
    }
    if (f->numeric && (r.op == "is" || r.op == "isnot" || r.op == "from" || r.op == "above" || r.op == "below") &&
        !IsNumber(r.value)) {
        *why = "\"" + r.value + "\" is not a number";
        return -1;
    }
    if (r.op == "from" && !IsNumber(r.value2)) {
        *why = "\"from\" needs two numbers: from A to B";
        return -1;
    }
    if (r.value.empty()) {
        *why = "missing value";
        return -1;
    }
    if (!ValidUtf8(r.value) || !ValidUtf8(r.value2)) {
        *why = "value is not valid UTF-8";
        return -1;
    }
    return 0;
}

int SmartRuleParse(const std::string &text, SmartRule *rule, std::string *why)
{
    std::string t = Trim(text);
    size_t s1 = t.find(' ');
    if (s1 == std::string::npos) {
        *why = "a rule is FIELD OPERATOR VALUE, e.g. \"genre is Jazz\"";
        return -1;
    }
    SmartRule r;
    r.field = t.substr(0, s1);
    std::string rest = Trim(t.substr(s1));
    // Two-word operators.
    static const struct {
        const char *text, *op;
    } kMulti[] = {{"is not ", "isnot"}, {"starts with ", "startswith"}};
    bool done = false;
    for (const auto &m : kMulti) {
        if (rest.compare(0, strlen(m.text), m.text) == 0) {
            r.op = m.op;
            r.value = Trim(rest.substr(strlen(m.text)));
            done = true;
            break;
        }
    }
    if (!done) {
        size_t s2 = rest.find(' ');
        r.op = rest.substr(0, s2);
        r.value = s2 == std::string::npos ? std::string() : Trim(rest.substr(s2));
    }
    for (char &c : r.field)
        c = (char)tolower((unsigned char)c);
    for (char &c : r.op)
        c = (char)tolower((unsigned char)c);
    if (r.op == "from") {
        size_t to = r.value.find(" to ");
        if (to == std::string::npos) {
            *why = "\"from\" needs two numbers: from A to B";
            return -1;
        }
        r.value2 = Trim(r.value.substr(to + 4));
        r.value = Trim(r.value.substr(0, to));
    }
    if (CheckRule(r, why) != 0)
        return -1;
    *rule = r;
    return 0;
}

std::string SmartRuleText(const SmartRule &r)
{
    if (r.op == "from")
        return r.field + " from " + r.value + " to " + r.value2;
    if (r.op == "isnot")
        return r.field + " is not " + r.value;
    if (r.op == "startswith")
        return r.field + " starts with " + r.value;
    return r.field + " " + r.op + " " + r.value;
}

int MediaLib::ListSmart(std::vector<SmartPlaylist> *lists)
{
    lists->clear();
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT id, name, match_any FROM smart ORDER BY id");
    Stmt r(db_, "SELECT field, op, value, value2 FROM smart_rules WHERE smart_id = ? ORDER BY seq");
    if (!s.ok() || !r.ok())
        return Fail("cannot read the media library");
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        SmartPlaylist p;
        p.id = s.ColInt(0);
        p.name = s.Col(1);
        p.matchAny = s.ColInt(2) != 0;
        r.Int(1, p.id);
        int rr;
        while ((rr = r.Step()) == SQLITE_ROW)
            p.rules.push_back(SmartRule{r.Col(0), r.Col(1), r.Col(2), r.Col(3)});
        r.Reset();
        if (rr != SQLITE_DONE)
            return Fail("cannot read the media library");
        lists->push_back(p);
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::FindSmart(const std::string &name, SmartPlaylist *list)
{
    std::vector<SmartPlaylist> all;
    if (ListSmart(&all) != 0)
        return -1;
    for (const SmartPlaylist &p : all) {
        if (p.name == name) {
            *list = p;
            return 1;
        }
    }
    return 0;
}

int MediaLib::SaveSmart(const SmartPlaylist &list)
{
    if (!db_)
        return -1;
    if (list.name.empty() || !ValidUtf8(list.name)) {
        error_ = "a smart playlist needs a name in UTF-8";
        return -1;
    }
    if (list.rules.empty()) {
        error_ = "a smart playlist needs at least one rule";
        return -1;
    }
    for (const SmartRule &r : list.rules) {
        std::string why;
        if (CheckRule(r, &why) != 0) {
            error_ = "rule \"" + SmartRuleText(r) + "\": " + why;
            return -1;
        }
    }
    if (Exec("BEGIN IMMEDIATE") != 0)
        return Fail("cannot update the media library");
    auto rollback = [&]() {
        Fail("cannot save the smart playlist");
        Exec("ROLLBACK");
        return -1;
    };
    // An existing playlist keeps its place (id) in the library's order.
    Stmt up(db_, "INSERT INTO smart(name, match_any) VALUES(?, ?)"
                 " ON CONFLICT(name) DO UPDATE SET match_any = excluded.match_any");
    if (!up.ok())
        return rollback();
    up.Text(1, list.name);
    up.Int(2, list.matchAny ? 1 : 0);
    if (up.Step() != SQLITE_DONE)
        return rollback();
    Stmt id(db_, "SELECT id FROM smart WHERE name = ?");
    if (!id.ok())
        return rollback();
    id.Text(1, list.name);
    if (id.Step() != SQLITE_ROW)
        return rollback();
    int64_t sid = id.ColInt(0);
    Stmt del(db_, "DELETE FROM smart_rules WHERE smart_id = ?");
    if (!del.ok())
        return rollback();
    del.Int(1, sid);
    if (del.Step() != SQLITE_DONE)
        return rollback();
    Stmt ins(db_, "INSERT INTO smart_rules(smart_id, seq, field, op, value, value2) VALUES(?,?,?,?,?,?)");
    if (!ins.ok())
        return rollback();
    int seq = 0;
    for (const SmartRule &r : list.rules) {
        ins.Int(1, sid);
        ins.Int(2, seq++);
        ins.Text(3, r.field);
        ins.Text(4, r.op);
        ins.Text(5, r.value);
        ins.Text(6, r.value2);
        if (ins.Step() != SQLITE_DONE)
            return rollback();
        ins.Reset();
    }
    if (Exec("COMMIT") != 0)
        return rollback();
    return 0;
}

int MediaLib::DeleteSmart(const std::string &name)
{
    if (!db_)
        return -1;
    Stmt s(db_, "DELETE FROM smart WHERE name = ?");
    if (!s.ok())
        return Fail("cannot update the media library");
    s.Text(1, name);
    if (s.Step() != SQLITE_DONE)
        return Fail("cannot update the media library");
    return sqlite3_changes(db_) > 0 ? 1 : 0;
}

namespace {
// One value bound to a smart playlist's query.
struct Bind {
    bool numeric;
    std::string text;
};

// The SQL condition of one checked rule, made only of fixed fragments chosen
// from the field and operator tables; its values are appended to binds.
std::string RuleCondition(const SmartRule &r, std::vector<Bind> *binds)
{
    const FieldDef *f = FindField(r.field);
    std::string col = f->column;
    std::string cond;
    bool num = f->numeric;
    if (r.op == "is" || r.op == "isnot") {
        cond = col + (r.op == "is" ? " = ?" : " <> ?") + (num ? "" : " COLLATE NOCASE");
        binds->push_back({num, r.value});
    } else if (r.op == "contains" || r.op == "startswith") {
        std::string esc;
        for (char c : r.value) {
            if (c == '%' || c == '_' || c == '\\')
                esc += '\\';
            esc += c;
        }
        cond = "CAST(" + col + " AS TEXT) LIKE ? ESCAPE '\\'";
        binds->push_back({false, (r.op == "contains" ? "%" : "") + esc + "%"});
    } else if (r.op == "from") {
        cond = col + " BETWEEN ? AND ?";
        binds->push_back({true, r.value});
        binds->push_back({true, r.value2});
    } else if (r.op == "above") {
        cond = col + " > ?";
        binds->push_back({true, r.value});
    } else {
        cond = col + " < ?";
        binds->push_back({true, r.value});
    }
    return cond;
}
}  // namespace

int MediaLib::SmartSongs(const SmartPlaylist &list, std::vector<MediaSong> *songs, int start, int limit,
                         int *total)
{
    songs->clear();
    *total = 0;
    if (!db_)
        return -1;
    // The SQL text is made only of fixed fragments chosen from the field and
    // operator tables; every value is bound as a parameter.
    std::string where;
    std::vector<Bind> binds;
    for (const SmartRule &r : list.rules) {
        std::string why;
        if (CheckRule(r, &why) != 0) {
            error_ = "smart playlist \"" + list.name + "\": rule \"" + SmartRuleText(r) + "\": " + why;
            TLOG("%s", error_.c_str());
            return -1;
        }
        std::string cond = RuleCondition(r, &binds);
        if (!where.empty())
            where += list.matchAny ? " OR " : " AND ";
        where += "(" + cond + ")";
    }
    if (where.empty())
        where = "1";
    auto bindAll = [&](Stmt &s) {
        int i = 1;
        for (const Bind &b : binds) {
            if (b.numeric)
                s.Real(i++, strtod(b.text.c_str(), nullptr));
            else
                s.Text(i++, b.text);
        }
        return i;
    };
    Stmt c(db_, ("SELECT count(*) FROM songs WHERE " + where).c_str());
    if (!c.ok())
        return Fail("cannot read the media library");
    bindAll(c);
    if (c.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    *total = (int)c.ColInt(0);
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs WHERE " + where + kSongOrder +
                      " LIMIT ? OFFSET ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    int i = bindAll(s);
    s.Int(i, limit > 0 ? limit : -1);
    s.Int(i + 1, start > 0 ? start : 0);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        songs->emplace_back();
        ReadSong(s, &songs->back());
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}
