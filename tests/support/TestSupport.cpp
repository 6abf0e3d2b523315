#include "support/TestSupport.h"

#include <cstdlib>
#include <dirent.h>
#include <fstream>
#include <sstream>
#include <ftw.h>
#include <stdexcept>
#include <unistd.h>

#include "vela/log.h"

namespace VELA {
namespace Test {

LogCapture::LogCapture() { VELA::System::LogSetSink(&LogCapture::Sink, this); }

LogCapture::~LogCapture() { VELA::System::LogSetSink(nullptr, nullptr); }

void LogCapture::Sink(int priority, const char* line, void* arg)
{
    LogCapture* self = static_cast<LogCapture*>(arg);
    self->lines_.emplace_back(line);
    self->priorities_.push_back(priority);
}

int LogCapture::PriorityOf(std::initializer_list<std::string> texts) const
{
    for (size_t i = 0; i < lines_.size(); ++i) {
        bool all = true;
        for (const std::string& text : texts) {
            all = all && lines_[i].find(text) != std::string::npos;
        }
        if (all) {
            return priorities_[i];
        }
    }
    return -1;
}

bool LogCapture::Contains(const std::string& text) const { return PriorityOf({text}) != -1; }

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

std::string ReadText(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

std::vector<std::string> DirEntries(const std::string& dir)
{
    std::vector<std::string> names;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    while (struct dirent* e = readdir(d)) {
        if (std::string(e->d_name) != "." && std::string(e->d_name) != "..") {
            names.push_back(e->d_name);
        }
    }
    closedir(d);
    return names;
}

}  // namespace Test
}  // namespace VELA
