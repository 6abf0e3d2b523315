// Uploads: form fields into string tables, file parts into uniquely named
// files of a directory, over the multipart reader. Contract: vela/upload.h.
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <new>
#include <string>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "cgi/CgiContext.h"
#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "transfer/MultipartReader.h"
#include "transfer/UploadDir.h"
#include "vela/log.h"
#include "vela/upload.h"
#include "vela/uploaddir.h"
#include "vela/vlibc.h"

using VELA::System::ScopedFd;
using VELA::Transfer::MultipartPart;
using VELA::Transfer::MultipartReader;
using VELA::Transfer::MultipartSink;
using VELA::Transfer::UploadProgressFn;
using VELA::Transfer::UploadReader;

namespace {

constexpr int kMaxParts = 10000;
constexpr size_t kMaxFieldValue = 64 * 1024;
constexpr size_t kMaxFieldBytes = 4 * 1024 * 1024;
constexpr size_t kMaxFileName = 255;
constexpr int kCreateAttempts = 32;
const char kStoredPrefix[] = "upload-";
constexpr size_t kStoredRandom = 16;
constexpr size_t kStoredNameLength = sizeof(kStoredPrefix) - 1 + kStoredRandom;

struct StoredFile {
    std::string key;   // key in the files table
    std::string path;  // where it was stored
    std::string name;  // the client's base name
};

}  // namespace

struct VELA::Transfer::UploadReader {
    MultipartReader mp;
    bool pending = false;       // a file part's headers are read, its content not
    std::string pendingField;
    std::string pendingName;    // client's base name
    PVLIBCSZHASH fields = nullptr;  // every field read so far
    size_t fieldBytes = 0;
    int parts = 0;
    std::vector<StoredFile> files;  // every file stored so far
    std::unordered_set<std::string> fileKeys;
    std::unordered_map<std::string, int> nextSuffix;

    UploadReader() = default;
    UploadReader(const UploadReader&) = delete;
    UploadReader& operator=(const UploadReader&) = delete;
    ~UploadReader() { VLIBCSzHashFree(fields); }
};

namespace {

bool HasControlByte(const std::string& s)
{
    for (unsigned char c : s) {
        if (c < 0x20 || c == 0x7f) {
            return true;
        }
    }
    return false;
}

// The base name of the file name a client sent: after the last "/" or "\"
// (browsers on Windows may send a whole path). False when nothing usable is
// left.
bool ClientBaseName(const std::string& sent, std::string& base)
{
    const size_t slash = sent.find_last_of("/\\");
    base = slash == std::string::npos ? sent : sent.substr(slash + 1);
    return !base.empty() && base != "." && base != ".." && base.size() <= kMaxFileName && !HasControlByte(base);
}

class FieldSink : public MultipartSink {
public:
    explicit FieldSink(const std::string& name) : name_(name) {}
    int Write(const char* data, size_t len) override
    {
        if (len > kMaxFieldValue - value_.size()) {
            VELA_LOG_ERR("upload refused: field \"%.64s\" longer than %zu bytes", name_.c_str(), kMaxFieldValue);
            return VELA_UPLOAD_ERR_LIMIT;
        }
        try {
            value_.append(data, len);
        } catch (const std::exception&) {
            return VELA_UPLOAD_ERR_MEMORY;
        }
        return 0;
    }
    const std::string& Value() const { return value_; }

private:
    const std::string& name_;
    std::string value_;
};

class CountSink : public MultipartSink {
public:
    int Write(const char*, size_t len) override
    {
        bytes_ += len;
        return 0;
    }
    unsigned long long Bytes() const { return bytes_; }

private:
    unsigned long long bytes_ = 0;
};

class FileSink : public MultipartSink {
public:
    FileSink(int fd, const std::string& path) : fd_(fd), path_(path) {}
    int Write(const char* data, size_t len) override
    {
        if (!VELA::System::WriteAll(fd_, data, len)) {
            VELA_LOG_ERR("upload failed: writing %s: %m", path_.c_str());
            return VELA_UPLOAD_ERR_WRITE;
        }
        return 0;
    }

private:
    int fd_;
    const std::string& path_;
};

// The files one call creates, removed again unless the call succeeds.
class CreatedFiles {
public:
    explicit CreatedFiles(int dirfd) : dirfd_(dirfd) {}
    CreatedFiles(const CreatedFiles&) = delete;
    CreatedFiles& operator=(const CreatedFiles&) = delete;
    ~CreatedFiles()
    {
        if (keep_) {
            return;
        }
        for (const std::string& name : names_) {
            if (unlinkat(dirfd_, name.c_str(), 0) != 0 && errno != ENOENT) {
                VELA_LOG_ERR("cannot remove the partial upload %s: %m", name.c_str());
            }
        }
    }
    // False when memory runs out (the caller removes the file itself).
    bool Add(const std::string& name)
    {
        try {
            names_.push_back(name);
            return true;
        } catch (const std::exception&) {
            return false;
        }
    }
    void Keep() { keep_ = true; }

private:
    int dirfd_;
    std::vector<std::string> names_;
    bool keep_ = false;
};

// The directory for stored files, opened once per call.
struct UploadDir {
    ScopedFd fd;
    std::string path;  // without a trailing "/" (except "/" itself)
};

int OpenUploadDir(const char* dir, UploadDir& out)
{
    if (dir == nullptr || dir[0] == '\0') {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    out.path = dir;
    while (out.path.size() > 1 && out.path.back() == '/') {
        out.path.pop_back();
    }
    if (out.path.size() + 1 + kStoredNameLength >= PATH_MAX) {
        VELA_LOG_ERR("upload directory path too long");
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    // The process's private upload directory is used through the descriptor
    // it was made with; any other directory is opened by its path.
    out.fd.Reset(VELA::Transfer::DupUploadDir(out.path));
    if (out.fd.Get() < 0) {
        out.fd.Reset(open(out.path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    }
    if (out.fd.Get() < 0) {
        VELA_LOG_ERR("cannot open the upload directory %s: %m", out.path.c_str());
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    return 1;
}

// A new file "upload-" + 16 random characters in the directory, created
// exclusively with mode 0600. The descriptor, or -1 (logged).
int CreateStoredFile(const UploadDir& dir, std::string& name)
{
    static const char kAlphabet[] = "abcdefghijklmnopqrstuvwxyz234567";  // 32 symbols, 5 bits each
    for (int attempt = 0; attempt < kCreateAttempts; ++attempt) {
        unsigned char random[kStoredRandom];
        size_t got = 0;
        while (got < sizeof(random)) {
            const ssize_t n = getrandom(random + got, sizeof(random) - got, 0);
            if (n < 0) {
                if (errno == EINTR) {
                    continue;
                }
                VELA_LOG_ERR("getrandom: %m");
                return -1;
            }
            got += static_cast<size_t>(n);
        }
        name = kStoredPrefix;
        for (unsigned char c : random) {
            name += kAlphabet[c & 31];
        }
        const int fd = openat(dir.fd.Get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600);
        if (fd >= 0) {
            return fd;
        }
        if (errno != EEXIST) {
            VELA_LOG_ERR("upload failed: cannot create a file in %s: %m", dir.path.c_str());
            return -1;
        }
    }
    VELA_LOG_ERR("upload failed: no free file name in %s", dir.path.c_str());
    return -1;
}

// A file part whose headers were just read: one with an empty file name is
// a file input left empty, skipped (0) unless it carries content; any other
// waits to be stored (1), the client's file name reduced to its base name.
// A negative code (final for the reader) when it is refused.
int TakeFilePart(UploadReader* r, MultipartPart& part)
{
    MultipartReader& mp = r->mp;
    if (part.fileName.empty()) {
        CountSink count;
        const int rc = mp.ReadContent(&count);
        if (rc < 0) {
            return rc;
        }
        if (count.Bytes() > 0) {
            VELA_LOG_ERR("upload refused: file part \"%.64s\" has %llu bytes but no file name", part.name.c_str(),
                         count.Bytes());
            return mp.Fail(VELA_UPLOAD_ERR_FILENAME);
        }
        return 0;
    }
    std::string base;
    if (!ClientBaseName(part.fileName, base)) {
        VELA_LOG_ERR("upload refused: file name \"%.64s\" of field \"%.64s\"", part.fileName.c_str(),
                     part.name.c_str());
        return mp.Fail(VELA_UPLOAD_ERR_FILENAME);
    }
    r->pendingField.swap(part.name);
    r->pendingName.swap(base);
    r->pending = true;
    return 1;
}

// The content of the field part `part` into the reader's field table,
// within the bounds of one field and of all fields. 1, or a negative code
// (final for the reader).
int TakeField(UploadReader* r, const MultipartPart& part)
{
    MultipartReader& mp = r->mp;
    FieldSink sink(part.name);
    const int rc = mp.ReadContent(&sink);
    if (rc < 0) {
        return rc;
    }
    const std::string& value = sink.Value();
    if (memchr(value.data(), '\0', value.size()) != nullptr) {
        VELA_LOG_ERR("upload refused: field \"%.64s\" holds a NUL byte", part.name.c_str());
        return mp.Fail(VELA_UPLOAD_ERR_FIELD);
    }
    r->fieldBytes += part.name.size() + value.size();
    if (r->fieldBytes > kMaxFieldBytes) {
        VELA_LOG_ERR("upload refused: form fields longer than %zu bytes in all", kMaxFieldBytes);
        return mp.Fail(VELA_UPLOAD_ERR_LIMIT);
    }
    if (VLIBCSzHashSetValue(r->fields, part.name.c_str(), value.c_str()) != 0) {
        return mp.Fail(VELA_UPLOAD_ERR_MEMORY);
    }
    return 1;
}

// Reads form fields until a file part waits or the body ends. 1, or a
// negative code (final for the reader).
int ReadFieldsInternal(UploadReader* r)
{
    MultipartReader& mp = r->mp;
    if (mp.Failure() != 0) {
        return mp.Failure();
    }
    MultipartPart part;
    while (!r->pending && !mp.AtEnd()) {
        int rc = mp.NextPart(part);
        if (rc < 0) {
            return rc;
        }
        if (rc == 0) {
            break;
        }
        if (++r->parts > kMaxParts) {
            VELA_LOG_ERR("upload refused: more than %d parts", kMaxParts);
            return mp.Fail(VELA_UPLOAD_ERR_LIMIT);
        }
        rc = part.hasFileName ? TakeFilePart(r, part) : TakeField(r, part);
        if (rc < 0) {
            return rc;
        }
    }
    return 1;
}

// The key of a stored file: its field name, or "<name>_<n>" (n = 2, 3, ...)
// when that key is taken already.
std::string UniqueFileKey(UploadReader* r, const std::string& name)
{
    std::string key = name;
    if (r->fileKeys.count(key) != 0) {
        int& next = r->nextSuffix[name];
        if (next < 2) {
            next = 2;
        }
        do {
            key = name + "_" + std::to_string(next++);
        } while (r->fileKeys.count(key) != 0);
    }
    r->fileKeys.insert(key);
    return key;
}

// Stores the waiting file part. 1 with `out` filled and the file listed in
// `created`, or a negative code (final for the reader, except
// VELA_UPLOAD_ERR_STATE when no file waits).
int StoreFile(UploadReader* r, const UploadDir& dir, CreatedFiles& created, StoredFile& out)
{
    if (!r->pending) {
        return VELA_UPLOAD_ERR_STATE;
    }
    std::string name;
    ScopedFd fd(CreateStoredFile(dir, name));
    if (fd.Get() < 0) {
        return r->mp.Fail(VELA_UPLOAD_ERR_WRITE);
    }
    if (!created.Add(name)) {
        unlinkat(dir.fd.Get(), name.c_str(), 0);
        return r->mp.Fail(VELA_UPLOAD_ERR_MEMORY);
    }
    out.path = dir.path == "/" ? "/" + name : dir.path + "/" + name;
    FileSink sink(fd.Get(), out.path);
    const int rc = r->mp.ReadContent(&sink);
    if (rc < 0) {
        return rc;
    }
    if (close(fd.Release()) != 0) {
        VELA_LOG_ERR("upload failed: closing %s: %m", out.path.c_str());
        return r->mp.Fail(VELA_UPLOAD_ERR_WRITE);
    }
    out.key = UniqueFileKey(r, r->pendingField);
    out.name = r->pendingName;
    r->pending = false;
    r->pendingField.clear();
    r->pendingName.clear();
    return 1;
}

// Copies every entry of `src` into `dst`. 1, or VELA_UPLOAD_ERR_MEMORY.
int CopyTable(PVLIBCSZHASH src, PVLIBCSZHASH dst)
{
    const int count = VLIBCSzHashCount(src);
    for (int i = 0; i < count; ++i) {
        if (VLIBCSzHashSetValue(dst, VLIBCSzHashKeyAt(src, i), VLIBCSzHashValueAt(src, i)) != 0) {
            return VELA_UPLOAD_ERR_MEMORY;
        }
    }
    return 1;
}

// "<key>" -> path into `files`, "<key>_name" -> client's name into `names`.
int ListFile(const StoredFile& file, PVLIBCSZHASH files, PVLIBCSZHASH names)
{
    const std::string nameKey = file.key + "_name";
    if (VLIBCSzHashSetValue(names, nameKey.c_str(), file.name.c_str()) != 0 ||
        VLIBCSzHashSetValue(files, file.key.c_str(), file.path.c_str()) != 0) {
        return VELA_UPLOAD_ERR_MEMORY;
    }
    return 1;
}

int ReadAllInternal(UploadReader* r, PVLIBCSZHASH fields, PVLIBCSZHASH files, const char* dir)
{
    if (r->mp.Failure() != 0) {
        return r->mp.Failure();
    }
    UploadDir upload;
    int rc = OpenUploadDir(dir, upload);
    if (rc < 0) {
        return rc;
    }
    CreatedFiles created(upload.fd.Get());
    std::vector<StoredFile> stored;
    for (;;) {
        if ((rc = ReadFieldsInternal(r)) < 0) {
            return rc;
        }
        if (!r->pending) {
            break;
        }
        StoredFile file;
        if ((rc = StoreFile(r, upload, created, file)) < 0) {
            return rc;
        }
        stored.push_back(std::move(file));
    }
    r->files.insert(r->files.end(), stored.begin(), stored.end());
    if ((rc = CopyTable(r->fields, fields)) < 0) {
        return r->mp.Fail(rc);
    }
    for (const StoredFile& file : r->files) {
        if ((rc = ListFile(file, files, fields)) < 0) {
            return r->mp.Fail(rc);
        }
    }
    created.Keep();
    return 1;
}

// ---- The process's reader over standard input ----

struct ProcessUpload {
    bool opened = false;
    int openResult = 0;
    UploadReader* reader = nullptr;
};

ProcessUpload& Process()
{
    static ProcessUpload process;
    return process;
}

int ProcessReader(UploadReader** reader)
{
    ProcessUpload& process = Process();
    if (!process.opened) {
        process.opened = true;
        const char* lengthText = getenv("CONTENT_LENGTH");
        const long long length =
            VELA::System::ContentLength(lengthText, lengthText != nullptr ? strlen(lengthText) : 0, LLONG_MAX);
        if (length <= 0) {
            VELA_LOG_ERR("upload refused: CONTENT_LENGTH \"%.32s\" is not a length",
                         lengthText != nullptr ? lengthText : "(none)");
            process.openResult = VELA_UPLOAD_ERR_NO_BODY;
        } else {
            process.openResult = VELA::Transfer::UploadReaderOpen(STDIN_FILENO, static_cast<unsigned long long>(length),
                                                                  getenv("CONTENT_TYPE"), &process.reader);
        }
    }
    *reader = process.reader;
    return process.openResult;
}

// Writes the waiting file part's names into the caller's buffers ("" when
// none waits). VELA_UPLOAD_ERR_LIMIT when they do not fit (buffers "").
int FillPending(UploadReader* r, char* fileName, size_t fileNameSize, char* fieldName, size_t fieldNameSize,
                char* fieldValue, size_t fieldValueSize)
{
    fileName[0] = fieldName[0] = fieldValue[0] = '\0';
    if (r == nullptr || !r->pending) {
        return 1;
    }
    const std::string& field = r->pendingField;
    const std::string& name = r->pendingName;
    if (field.size() >= fieldNameSize || name.size() >= fileNameSize || name.size() >= fieldValueSize) {
        VELA_LOG_ERR("upload refused: field name \"%.64s\" or file name \"%.64s\" too long", field.c_str(),
                     name.c_str());
        return VELA_UPLOAD_ERR_LIMIT;
    }
    memcpy(fieldName, field.c_str(), field.size() + 1);
    memcpy(fileName, name.c_str(), name.size() + 1);
    memcpy(fieldValue, name.c_str(), name.size() + 1);
    return 1;
}

bool ValidBuffers(char* fileName, size_t fileNameSize, char* fieldName, size_t fieldNameSize, char* fieldValue,
                  size_t fieldValueSize)
{
    return fileName != nullptr && fileNameSize > 0 && fieldName != nullptr && fieldNameSize > 0 &&
           fieldValue != nullptr && fieldValueSize > 0;
}

// The handle's table, created on first use.
PVLIBCSZHASH& EnsureTable(PVLIBCSZHASH& table)
{
    if (table == nullptr) {
        table = VLIBCSzHashAlloc(16);
    }
    return table;
}

// Opens in `upload` the directory (a path of the system) that the file
// part waiting in `r` is to be stored in. 1, or a negative code:
// VELA_UPLOAD_ERR_ARGUMENT for an invalid `dir`, the reader's failure, or
// VELA_UPLOAD_ERR_STATE when no file part waits. Can throw std::bad_alloc.
int OpenDirForWaitingFile(UploadReader* r, const char* dir, UploadDir& upload)
{
    const std::string resolved = VELA::System::ResolvePath(dir);
    if (resolved.empty()) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    if (r->mp.Failure() != 0) {
        return r->mp.Failure();
    }
    if (!r->pending) {
        return VELA_UPLOAD_ERR_STATE;
    }
    return OpenUploadDir(resolved.c_str(), upload);
}

}  // namespace

// ---- Reader over a file descriptor ----

int VELA::Transfer::UploadReaderOpen(int fd, unsigned long long contentLength, const char* contentType,
                                     UploadReader** reader)
{
    if (reader == nullptr) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    *reader = nullptr;
    if (fd < 0) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    if (contentLength == 0) {
        VELA_LOG_ERR("upload refused: empty body");
        return VELA_UPLOAD_ERR_NO_BODY;
    }
    std::string boundary;
    if (!VELA::Transfer::ParseMultipartContentType(contentType, boundary)) {
        return VELA_UPLOAD_ERR_CONTENT_TYPE;
    }
    UploadReader* r = new (std::nothrow) VELA::Transfer::UploadReader();
    if (r == nullptr) {
        return VELA_UPLOAD_ERR_MEMORY;
    }
    r->fields = VLIBCSzHashAlloc(16);
    if (r->fields == nullptr || r->mp.Open(fd, contentLength, boundary) != 1) {
        delete r;
        return VELA_UPLOAD_ERR_MEMORY;
    }
    *reader = r;
    return 1;
}

void VELA::Transfer::UploadReaderFree(UploadReader* reader) { delete reader; }

int VELA::Transfer::UploadReadFields(UploadReader* reader, PVLIBCSZHASH fields, UploadProgressFn progress)
{
    if (reader == nullptr) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    try {
        reader->mp.SetProgress(progress);
        const int rc = ReadFieldsInternal(reader);
        reader->mp.SetProgress(nullptr);
        if (rc < 0) {
            return rc;
        }
        return fields != nullptr ? CopyTable(reader->fields, fields) : 1;
    } catch (const std::exception&) {
        reader->mp.SetProgress(nullptr);
        return reader->mp.Fail(VELA_UPLOAD_ERR_MEMORY);
    }
}

const char* VELA::Transfer::UploadPendingField(UploadReader* reader)
{
    return reader != nullptr && reader->pending ? reader->pendingField.c_str() : nullptr;
}

const char* VELA::Transfer::UploadPendingFileName(UploadReader* reader)
{
    return reader != nullptr && reader->pending ? reader->pendingName.c_str() : nullptr;
}

int VELA::Transfer::UploadReadFile(UploadReader* reader, const char* dir, char* path, size_t pathSize,
                                   PVLIBCSZHASH fileTable, UploadProgressFn progress)
{
    if (reader == nullptr || path == nullptr || pathSize == 0 || dir == nullptr) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    path[0] = '\0';
    try {
        if (reader->mp.Failure() != 0) {
            return reader->mp.Failure();
        }
        if (!reader->pending) {
            return VELA_UPLOAD_ERR_STATE;
        }
        UploadDir upload;
        int rc = OpenUploadDir(dir, upload);
        if (rc < 0) {
            return rc;
        }
        if (upload.path.size() + 1 + kStoredNameLength >= pathSize) {
            return VELA_UPLOAD_ERR_ARGUMENT;
        }
        CreatedFiles created(upload.fd.Get());
        StoredFile file;
        reader->mp.SetProgress(progress);
        rc = StoreFile(reader, upload, created, file);
        reader->mp.SetProgress(nullptr);
        if (rc < 0) {
            return rc;
        }
        if (fileTable != nullptr && ListFile(file, fileTable, fileTable) < 0) {
            return reader->mp.Fail(VELA_UPLOAD_ERR_MEMORY);
        }
        memcpy(path, file.path.c_str(), file.path.size() + 1);
        reader->files.push_back(std::move(file));
        created.Keep();
        return 1;
    } catch (const std::exception&) {
        reader->mp.SetProgress(nullptr);
        return reader->mp.Fail(VELA_UPLOAD_ERR_MEMORY);
    }
}

int VELA::Transfer::UploadReadAll(UploadReader* reader, PVLIBCSZHASH fields, PVLIBCSZHASH files, const char* dir,
                                  int flags, UploadProgressFn progress)
{
    if (reader == nullptr || fields == nullptr || files == nullptr || dir == nullptr || flags != 0) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    try {
        reader->mp.SetProgress(progress);
        const int rc = ReadAllInternal(reader, fields, files, dir);
        reader->mp.SetProgress(nullptr);
        return rc;
    } catch (const std::exception&) {
        reader->mp.SetProgress(nullptr);
        return reader->mp.Fail(VELA_UPLOAD_ERR_MEMORY);
    }
}

unsigned long long VELA::Transfer::UploadConsumed(UploadReader* reader)
{
    return reader != nullptr ? reader->mp.Consumed() : 0;
}

unsigned long long VELA::Transfer::UploadContentLength(UploadReader* reader)
{
    return reader != nullptr ? reader->mp.Length() : 0;
}

// ---- CGI library ----

int VelaCgiLoadUploadParams(VELACGI_CTX* ctx, UploadProgressFn progress, unsigned long long* contentLength,
                            char* fileName, size_t fileNameSize, char* fieldName, size_t fieldNameSize,
                            char* fieldValue, size_t fieldValueSize)
{
    if (contentLength != nullptr) {
        *contentLength = 0;
    }
    if (ctx == nullptr || !ValidBuffers(fileName, fileNameSize, fieldName, fieldNameSize, fieldValue, fieldValueSize)) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    fileName[0] = fieldName[0] = fieldValue[0] = '\0';
    UploadReader* reader = nullptr;
    int rc = ProcessReader(&reader);
    if (contentLength != nullptr) {
        *contentLength = VELA::Transfer::UploadContentLength(reader);
    }
    if (rc != 1) {
        return rc;
    }
    if (EnsureTable(ctx->upload.params) == nullptr) {
        return VELA_UPLOAD_ERR_MEMORY;
    }
    if ((rc = VELA::Transfer::UploadReadFields(reader, ctx->upload.params, progress)) < 0) {
        return rc;
    }
    return FillPending(reader, fileName, fileNameSize, fieldName, fieldNameSize, fieldValue, fieldValueSize);
}

int VelaCgiLoadUploadFileToDir(VELACGI_CTX* ctx, const char* dir, UploadProgressFn progress,
                               char* fileName, size_t fileNameSize, char* fieldName, size_t fieldNameSize,
                               char* fieldValue, size_t fieldValueSize)
{
    if (ctx == nullptr || !ValidBuffers(fileName, fileNameSize, fieldName, fieldNameSize, fieldValue, fieldValueSize)) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    UploadReader* r = nullptr;
    int rc = ProcessReader(&r);
    if (rc != 1) {
        return rc;
    }
    try {
        UploadDir upload;
        if ((rc = OpenDirForWaitingFile(r, dir, upload)) < 0) {
            return rc;
        }
        PVLIBCSZHASH table = VLIBCSzHashAlloc(2);
        if (table == nullptr || EnsureTable(ctx->upload.params) == nullptr) {
            VLIBCSzHashFree(table);
            return VELA_UPLOAD_ERR_MEMORY;
        }
        CreatedFiles created(upload.fd.Get());
        StoredFile file;
        r->mp.SetProgress(progress);
        rc = StoreFile(r, upload, created, file);
        if (rc > 0) {
            rc = ReadFieldsInternal(r);
        }
        r->mp.SetProgress(nullptr);
        if (rc > 0) {
            rc = ListFile(file, table, table);
        }
        if (rc > 0) {
            rc = CopyTable(r->fields, ctx->upload.params);
        }
        if (rc > 0) {
            rc = FillPending(r, fileName, fileNameSize, fieldName, fieldNameSize, fieldValue, fieldValueSize);
        }
        if (rc < 0) {
            VLIBCSzHashFree(table);
            return rc;
        }
        VLIBCSzHashFree(ctx->upload.files);
        ctx->upload.files = table;
        r->files.push_back(std::move(file));
        created.Keep();
        return 1;
    } catch (const std::exception&) {
        r->mp.SetProgress(nullptr);
        return r->mp.Fail(VELA_UPLOAD_ERR_MEMORY);
    }
}

int VelaCgiLoadUploadAll(PVLIBCSZHASH fields, PVLIBCSZHASH files, const char* dir, int flags,
                         UploadProgressFn progress)
{
    if (fields == nullptr || files == nullptr || flags != 0) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    UploadReader* reader = nullptr;
    const int rc = ProcessReader(&reader);
    if (rc != 1) {
        return rc;
    }
    std::string resolved;
    try {
        resolved = VELA::System::ResolvePath(dir);
    } catch (const std::exception&) {
        return VELA_UPLOAD_ERR_MEMORY;
    }
    if (resolved.empty()) {
        return VELA_UPLOAD_ERR_ARGUMENT;
    }
    return VELA::Transfer::UploadReadAll(reader, fields, files, resolved.c_str(), flags, progress);
}

PVLIBCSZHASH VelaCgiGetUploadParams(VELACGI_CTX* ctx) { return ctx != nullptr ? ctx->upload.params : nullptr; }

PVLIBCSZHASH VelaCgiGetUploadFiles(VELACGI_CTX* ctx) { return ctx != nullptr ? ctx->upload.files : nullptr; }

void VelaCgiUploadReset(void)
{
    ProcessUpload& process = Process();
    VELA::Transfer::UploadReaderFree(process.reader);
    process = ProcessUpload();
    VELA::Transfer::UploadDirRemove();
}
