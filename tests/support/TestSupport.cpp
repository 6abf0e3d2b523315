#include "support/TestSupport.h"

#include <cstdlib>
#include <ftw.h>
#include <stdexcept>
#include <unistd.h>

#include "vela/log.h"

namespace VELA {
namespace Test {

LogCapture::LogCapture() { VelaLogSetSink(&LogCapture::Sink, this); }

LogCapture::~LogCapture() { VelaLogSetSink(nullptr, nullptr); }

void LogCapture::Sink(int, const char* line, void* arg)
{
    static_cast<LogCapture*>(arg)->lines_.emplace_back(line);
}

bool LogCapture::Contains(const std::string& text) const
{
    for (const auto& line : lines_) {
        if (line.find(text) != std::string::npos) {
            return true;
        }
    }
    return false;
}

TempDir::TempDir()
{
    const char* base = getenv("TMPDIR");
    std::string tmpl = std::string(base && *base ? base : "/tmp") + "/vela-test-XXXXXX";
    if (!mkdtemp(&tmpl[0])) {
        throw std::runtime_error("mkdtemp failed");
    }
    path_ = tmpl;
}

static int RemoveOne(const char* path, const struct stat*, int, struct FTW*)
{
    return remove(path);
}

TempDir::~TempDir() { nftw(path_.c_str(), RemoveOne, 16, FTW_DEPTH | FTW_PHYS); }

ScopedEnv::ScopedEnv(const char* name, const char* value) : name_(name)
{
    const char* old = getenv(name);
    had_ = old != nullptr;
    if (had_) {
        old_ = old;
    }
    if (value) {
        setenv(name, value, 1);
    } else {
        unsetenv(name);
    }
}

ScopedEnv::~ScopedEnv()
{
    if (had_) {
        setenv(name_.c_str(), old_.c_str(), 1);
    } else {
        unsetenv(name_.c_str());
    }
}

}  // namespace Test
}  // namespace VELA
