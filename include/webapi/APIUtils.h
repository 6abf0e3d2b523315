// Running a few statements with full rights, writing the system
// information file, and the JSON pipe between a forked child and its parent.
#pragma once

#include <json/json.h>
#include <string>
#include <sys/types.h>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace VELA {

// Gains effective uid and gid 0 for its scope and puts the recorded
// effective ids back when it ends. Check Ok() before the guarded statements:
// they must be skipped when the rights could not be gained.
//
//   RunAsRootGuard guard(__FILE__, __LINE__, "IF_RUN_AS");
//   if (guard.Ok()) { ... }
class VELA_EXPORT RunAsRootGuard {
public:
    RunAsRootGuard(const char* file, int line, const char* label);
    ~RunAsRootGuard();
    RunAsRootGuard(const RunAsRootGuard&) = delete;
    RunAsRootGuard& operator=(const RunAsRootGuard&) = delete;
    bool Ok() const { return ok_; }

private:
    uid_t uid_;  // (uid_t)-1: leave as it is
    gid_t gid_;
    const char* file_;
    int line_;
    const char* label_;
    bool ok_;
};

#define IF_RUN_AS_ROOT()                                                   \
    if (::VELA::RunAsRootGuard _vela_root_guard{__FILE__, __LINE__, "IF_RUN_AS"}; \
        _vela_root_guard.Ok())

class VELA_EXPORT APIUtils {
public:
    // Writes key="value" into the system information file
    // (<root>/etc/velainfo.conf) with full rights.
    static bool SetVelaInfo(const std::string& key, const std::string& value);
};

// One-way channel through which a forked child hands JSON documents back to
// its parent. The parent calls Init before fork; the child keeps the write
// end (WriteOnly), the parent the read end (ReadOnly), so the parent reads
// end of file when the child dies before writing.
//
// Each document travels as its length (4 bytes, unsigned, native byte
// order: both ends are this program on this machine) followed by its
// compact JSON text. The ends are close-on-exec, so a program the child
// starts does not keep the pipe open; an end put on a standard descriptor
// with ReadOnly/WriteOnly is inherited as usual.
class VELA_EXPORT Pipe {
public:
    // The largest document ReadJson accepts (a bigger length is refused
    // before anything is allocated).
    static const unsigned int kMaxDocument = 64u << 20;

    Pipe();
    ~Pipe();  // Close()
    Pipe(const Pipe&) = delete;
    Pipe& operator=(const Pipe&) = delete;

    // Opens the pipe. False (both ends -1) when the system refuses.
    bool Init();
    // Keeps only the read end: closes the write end, then, if `fd` >= 0,
    // duplicates the read end onto `fd` and returns dup2's result (0 makes
    // the pipe the standard input). A negative `fd` only closes.
    int ReadOnly(int fd);
    // The mirror image: keeps only the write end (1 sends standard output
    // into the pipe).
    int WriteOnly(int fd);
    // Closes both ends; harmless when they are closed already.
    void Close();

    // Sends one document. False when the pipe took less than all of it.
    bool WriteJson(const Json::Value& value);
    // Zeroes `size` bytes of `buf`, then one read of up to `size` bytes from
    // the read end; read's result.
    int Read(char* buf, int size);
    // Receives one document. False (logged) at end of file before a
    // length, for a document too large, cut short or not valid JSON.
    bool ReadJson(Json::Value& out);

    int ReadFd() const { return fds_[0]; }
    int WriteFd() const { return fds_[1]; }

private:
    int fds_[2];  // read end, write end; -1 when closed
};

}  // namespace VELA

#pragma GCC visibility pop
