#include "support/TestSupport.h"

#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fstream>
#include <iterator>
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

ScopedEnv::ScopedEnv(const char* name, const char* value) : name_(name), had_(getenv(name) != nullptr)
{
    old_ = had_ ? getenv(name) : "";
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
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

std::vector<std::string> DirEntries(const std::string& dir)
{
    std::vector<std::string> names;
    if (DIR* d = opendir(dir.c_str())) {
        while (struct dirent* e = readdir(d)) {
            if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) {
                names.push_back(e->d_name);
            }
        }
        closedir(d);
    }
    return names;
}

}  // namespace Test
}  // namespace VELA
