#include "tarn_env.h"

#include <cstdlib>

namespace {

std::string ReadVar(const char *name)
{
    const char *v = getenv(name);
    return v ? std::string(v) : std::string();
}

}  // namespace

const std::string &TarnRoot()
{
    static const std::string root = [] {
        std::string r = ReadVar("TARN_ROOT");
        while (r.size() > 1 && r.back() == '/')
            r.pop_back();
        if (r == "/")
            r.clear();
        return r;
    }();
    return root;
}

std::string TarnPath(const char *fixedPath)
{
    if (!fixedPath)
        return std::string();
    const std::string &root = TarnRoot();
    if (root.empty() || fixedPath[0] != '/')
        return std::string(fixedPath);
    return root + fixedPath;
}

int TarnShmKeyPlayer()
{
    static const int key = [] {
        std::string v = ReadVar("TARN_SHM_KEY");
        if (v.empty())
            return 25521815;
        return static_cast<int>(strtol(v.c_str(), nullptr, 0));
    }();
    return key;
}

int TarnShmKeyPublished()
{
    return TarnShmKeyPlayer() + 1;
}

const std::string &TarnLogFile()
{
    static const std::string f = ReadVar("TARN_LOG_FILE");
    return f;
}

const std::string &TarnAudioOut()
{
    static const std::string out = [] {
        std::string v = ReadVar("TARN_AUDIO_OUT");
        return v.empty() ? std::string("default") : v;
    }();
    return out;
}

std::string TarnEnvGet(const char *name)
{
    return ReadVar(name);
}
