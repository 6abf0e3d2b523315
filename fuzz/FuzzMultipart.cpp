// Fuzz target: any bytes as a multipart/form-data upload. An input that
// starts with "multipart" gives its first line as the Content-Type and the
// rest as the body; any other input is the body under the boundary "XyZ".
// The body is read twice, whole (VELA::Transfer::UploadReadAll) and step by step
// (fields, then each file). Whatever the bytes: no crash, and a call that
// fails leaves no file of its own behind; a whole read that succeeds lists
// every file it stored.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <string>
#include <sys/mman.h>
#include <unistd.h>

#include "vela/log.h"
#include "vela/upload.h"
#include "vela/vlibc.h"

namespace {

void Quiet(int, const char*, void*) {}

char g_workDir[4096];

void RemoveWorkDir() { rmdir(g_workDir); }

// A fresh directory for the stored files, removed (empty) at exit.
const std::string& WorkDir()
{
    static const std::string dir = [] {
        const char* base = getenv("TMPDIR");
        std::string tmpl = std::string(base != nullptr && *base != '\0' ? base : "/tmp") + "/fuzz-multipart-XXXXXX";
        if (tmpl.size() >= sizeof(g_workDir) || mkdtemp(&tmpl[0]) == nullptr) {
            abort();
        }
        memcpy(g_workDir, tmpl.c_str(), tmpl.size() + 1);
        atexit(&RemoveWorkDir);
        return tmpl;
    }();
    return dir;
}

// Number of entries in the work directory; with `clear`, removes them.
int CountFiles(bool clear)
{
    DIR* d = opendir(WorkDir().c_str());
    if (d == nullptr) {
        abort();
    }
    int count = 0;
    while (struct dirent* e = readdir(d)) {
        if (strcmp(e->d_name, ".") == 0 || strcmp(e->d_name, "..") == 0) {
            continue;
        }
        ++count;
        if (clear) {
            unlink((WorkDir() + "/" + e->d_name).c_str());
        }
    }
    closedir(d);
    return count;
}

void Check(bool condition, const char* what)
{
    if (!condition) {
        fprintf(stderr, "FuzzMultipart: %s\n", what);
        abort();
    }
}

int BodyFd(const char* body, size_t size)
{
    static const int fd = memfd_create("body", MFD_CLOEXEC);
    Check(fd >= 0, "memfd_create");
    Check(ftruncate(fd, 0) == 0 && pwrite(fd, body, size, 0) == static_cast<ssize_t>(size), "memfd write");
    lseek(fd, 0, SEEK_SET);
    return fd;
}

void ReadWhole(const std::string& type, const char* body, size_t size)
{
    VELA::Transfer::UploadReader* reader = nullptr;
    if (VELA::Transfer::UploadReaderOpen(BodyFd(body, size), size, type.c_str(), &reader) != 1) {
        return;
    }
    PVLIBCSZHASH fields = VLIBCSzHashAlloc(8);
    PVLIBCSZHASH files = VLIBCSzHashAlloc(8);
    const int rc = VELA::Transfer::UploadReadAll(reader, fields, files, WorkDir().c_str(), 0, nullptr);
    if (rc == 1) {
        Check(CountFiles(false) == VLIBCSzHashCount(files), "a stored file is missing from the table");
        for (int i = 0; i < VLIBCSzHashCount(files); ++i) {
            Check(access(VLIBCSzHashValueAt(files, i), F_OK) == 0, "a listed file does not exist");
        }
    } else {
        Check(rc < 0, "failure that is not negative");
        Check(VLIBCSzHashCount(files) == 0 && CountFiles(false) == 0, "a failed read left a file");
    }
    VLIBCSzHashFree(fields);
    VLIBCSzHashFree(files);
    VELA::Transfer::UploadReaderFree(reader);
    CountFiles(true);
}

void ReadInSteps(const std::string& type, const char* body, size_t size)
{
    VELA::Transfer::UploadReader* reader = nullptr;
    if (VELA::Transfer::UploadReaderOpen(BodyFd(body, size), size, type.c_str(), &reader) != 1) {
        return;
    }
    char path[4096];
    for (int stored = 0;;) {
        if (VELA::Transfer::UploadReadFields(reader, nullptr, nullptr) != 1) {
            Check(CountFiles(false) == stored, "a failed field read changed the directory");
            break;
        }
        if (VELA::Transfer::UploadPendingField(reader) == nullptr) {
            break;
        }
        if (VELA::Transfer::UploadReadFile(reader, WorkDir().c_str(), path, sizeof(path), nullptr, nullptr) != 1) {
            Check(CountFiles(false) == stored, "a failed file read left its file");
            break;
        }
        ++stored;
        Check(CountFiles(false) == stored, "a stored file is missing");
    }
    VELA::Transfer::UploadReaderFree(reader);
    CountFiles(true);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    VELA::System::LogSetSink(&Quiet, nullptr);
    const char* bytes = reinterpret_cast<const char*>(data);
    std::string type = "multipart/form-data; boundary=XyZ";
    const char* body = bytes;
    size_t bodySize = size;
    if (size >= 9 && memcmp(bytes, "multipart", 9) == 0) {
        const void* eol = memchr(bytes, '\n', size);
        const size_t lineEnd = eol != nullptr ? static_cast<size_t>(static_cast<const char*>(eol) - bytes) : size;
        type.assign(bytes, lineEnd);
        body = bytes + (lineEnd < size ? lineEnd + 1 : size);
        bodySize = size - (body - bytes);
    }
    ReadWhole(type, body, bodySize);
    ReadInSteps(type, body, bodySize);
    return 0;
}
