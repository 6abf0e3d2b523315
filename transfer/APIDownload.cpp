// Downloads: the response's headers, then the file through the platform's
// HTTP file outputer.
#include "webapi/APIDownload.h"

#include <cerrno>
#include <fcntl.h>
#include <iostream>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include "transfer/APIDownloadPrivate.h"
#include "vela/httpoutput.h"
#include "vela/log.h"
#include "webapi/APIResponse.h"

namespace VELA {

namespace {

const char kDefaultType[] = "application/octet-stream";

bool SameName(const std::string& a, const char* b) { return strcasecmp(a.c_str(), b) == 0; }

bool HasLineBreak(const std::string& text) { return text.find_first_of("\r\n") != std::string::npos; }

bool IsReadableRegular(int fd)
{
    struct stat st;
    const int mode = fd < 0 ? -1 : fcntl(fd, F_GETFL);
    return mode >= 0 && (mode & O_ACCMODE) != O_WRONLY && (mode & O_PATH) == 0 && fstat(fd, &st) == 0 &&
           S_ISREG(st.st_mode);
}

// A stream the outputer can send: open for reading and not a directory.
// Regular files go out with their length; anything else (a pipe, a socket)
// to its end without one.
bool IsReadableStream(int fd)
{
    struct stat st;
    const int mode = fd < 0 ? -1 : fcntl(fd, F_GETFL);
    return mode >= 0 && (mode & O_ACCMODE) != O_WRONLY && (mode & O_PATH) == 0 && fstat(fd, &st) == 0 &&
           !S_ISDIR(st.st_mode);
}

}  // namespace

APIDownload::APIDownload() : d_(nullptr)
{
    APIResponse* own = new APIResponse(nullptr);
    d_ = new APIDownloadPrivate(this, own, true);
}

APIDownload::APIDownload(APIResponse* response) : d_(new APIDownloadPrivate(this, response, false)) {}

APIDownload::~APIDownload()
{
    if (d_->ownsResponse) {
        delete d_->response;
    }
    delete d_;
}

bool APIDownload::SetHeader(std::string const& name, std::string const& value)
{
    if (d_->response == nullptr) {
        return false;
    }
    return d_->response->SetHeader(name, value);
}

bool APIDownload::SetHeader(Json::Value const& headers)
{
    try {
        if (!headers.isObject()) {
            return headers.isNull();
        }
        for (auto it = headers.begin(); it != headers.end(); ++it) {
            if (!it->isString()) {
                continue;
            }
            if (!SetHeader(it.name(), it->asString())) {
                return false;
            }
        }
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

void APIDownload::SetMimeType(std::string const& mimeType)
{
    try {
        d_->mimeType = mimeType;
    } catch (const std::exception&) {
        d_->mimeType.clear();
    }
}

void APIDownload::SetMimeTypeFromFileName(std::string const& name)
{
    SetMimeType(HTTPFileOutputer::GetMimeType(name));
}

void APIDownload::PrintHeader()
{
    d_->outputer.SetWriteDisposition(true);
    d_->outputer.SetRangesEnabled(true);
    if (d_->response == nullptr) {
        return;
    }
    try {
        const Json::Value headers = d_->response->GetHeaders();
        for (auto it = headers.begin(); it != headers.end(); ++it) {
            if (!it->isString()) {
                continue;
            }
            const std::string name = it.name();
            const std::string value = it->asString();
            if (SameName(name, "Content-Type") || SameName(name, "Content-Length") || HasLineBreak(name) ||
                HasLineBreak(value)) {
                continue;
            }
            if (SameName(name, "Content-Disposition")) {
                d_->outputer.SetWriteDisposition(false);
            }
            if (SameName(name, "Status")) {
                d_->outputer.SetRangesEnabled(false);  // one status line: the handler's
            }
            std::cout << name << ": " << value << "\r\n";
        }
        std::cout.flush();
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory printing the headers of a download");
    }
}

// The response's headers, then the open file `fd` through the outputer; no
// JSON follows.
bool APIDownload::SendOpen(int fd, std::string const& name, std::string const& mimeType)
{
    PrintHeader();
    if (d_->response != nullptr) {
        d_->response->SetEnableOutput(false);
    }
    return d_->outputer.Output(fd, name, mimeType);
}

bool APIDownload::Output(std::string const& path)
{
    const int fd = HTTPFileOutputer::OpenForOutput(path);
    if (fd < 0) {
        VELA_LOG_ERR("download refused: %s: %s", path.c_str(),
                     errno == ELOOP ? "a symbolic link is on the path" : "not a regular file that can be opened");
        return false;
    }
    bool sent = false;
    try {
        const size_t slash = path.rfind('/');
        const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
        sent = SendOpen(fd, name, d_->mimeType.empty() ? HTTPFileOutputer::GetMimeType(path) : d_->mimeType);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory sending %s", path.c_str());
    }
    close(fd);
    return sent;
}

bool APIDownload::Output(int fd, std::string const& name)
{
    if (!IsReadableRegular(fd)) {
        VELA_LOG_ERR("download refused: the descriptor is not a readable regular file");
        return false;
    }
    try {
        return SendOpen(fd, name, d_->mimeType.empty() ? HTTPFileOutputer::GetMimeType(name) : d_->mimeType);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory sending a file");
        return false;
    }
}

bool APIDownload::Output(FILE* file)
{
    if (file == nullptr || !IsReadableStream(fileno(file))) {
        VELA_LOG_ERR("download refused: the stream cannot be read");
        return false;
    }
    PrintHeader();
    if (d_->response != nullptr) {
        d_->response->SetEnableOutput(false);
    }
    try {
        const std::string type = d_->mimeType.empty() ? std::string(kDefaultType) : d_->mimeType;
        return d_->outputer.Output(file, "", type);
    } catch (const std::exception&) {
        VELA_LOG_ERR("out of memory sending a file");
        return false;
    }
}

void APIDownload::SetXSendFileDisabled() { HTTP::FileOutputerHelper::SetFastOutputEnabled(false); }

bool APIDownload::GetXSendFileEnabled() { return HTTP::FileOutputerHelper::IsFastOutputEnabled(); }

}  // namespace VELA
