// One HTTP exchange with a peer appliance through the lazily loaded libcurl:
// the request built from a peer of the peers file (never from a URL a client
// gave), bodies streamed both ways, the JSON answer bounded.
#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <unistd.h>

#include "relay/LazyCurl.h"
#include "system/FileUtil.h"
#include "system/SigpipeBlock.h"
#include "system/SysInternal.h"
#include "vela/log.h"
#include "vela/relay.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace VELA {

namespace {

const char kEntryPath[] = "/webapi/entry.cgi";
const size_t kMaxHeaderBlock = 64u << 10;
const size_t kMaxHeaderValue = 1024;

// Form encoding of `params`: strings as they are, other values as compact
// JSON (what the web API parses back).
std::string FormEncode(const Json::Value& params)
{
    std::string out;
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    for (auto it = params.begin(); it != params.end(); ++it) {
        const std::string value = it->isString() ? it->asString() : Json::writeString(builder, *it);
        if (!out.empty()) {
            out += '&';
        }
        out += WebAPIUtil::URLEncode(it.name()) + "=" + WebAPIUtil::URLEncode(value);
    }
    return out;
}

bool SafeHeaderValue(const std::string& v)
{
    if (v.size() > kMaxHeaderValue) {
        return false;
    }
    for (char c : v) {
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

bool StartsWithNoCase(const std::string& text, const char* prefix)
{
    const size_t n = strlen(prefix);
    return text.size() >= n && strncasecmp(text.c_str(), prefix, n) == 0;
}

}  // namespace

struct CredRequestMgr::Impl {
    // What was added.
    bool added = false;
    RelayPeer peer;
    RelayRequest request;
    int timeout = kDefaultTimeout;

    // What came back.
    Json::Value response;
    int error = kOk;
    std::string errorText;
    long status = 0;
    bool streamed = false;

    // The exchange.
    std::string headerBlock;  // the current answer's header lines
    bool headerTooLarge = false;
    std::string contentType, contentLength, contentRange, disposition, acceptRanges;
    enum class Mode { kUndecided, kBuffer, kStream } mode = Mode::kUndecided;
    std::string body;
    bool bodyTooLarge = false;
    bool writeFailed = false;
    bool readFailed = false;
    long long toRead = 0;
    CURL* curl = nullptr;  // the handle during curl_easy_perform, for the callbacks

    void Fail(int code, const std::string& text)
    {
        error = code;
        errorText = text;
    }

    bool Add(const std::string& name, const RelayRequest& r)
    {
        if (added) {
            Fail(kBadRequest, "a request was already added");
            return false;
        }
        std::string why;
        const int found = Relay::FindPeer(name, peer, why);
        if (found < 0) {
            Fail(kPeersFile, why);
            return false;
        }
        if (found == 0) {
            Fail(kUnknownPeer, "no such peer");
            return false;
        }
        if (!r.params.isObject() || (r.bodyFd >= 0 && r.contentLength < 0) ||
            !SafeHeaderValue(r.contentType) || !SafeHeaderValue(r.range)) {
            Fail(kBadRequest, "invalid request");
            return false;
        }
        request = r;
        added = true;
        return true;
    }

    static size_t OnHeader(char* data, size_t size, size_t n, void* self)
    {
        return static_cast<Impl*>(self)->Header(data, size * n);
    }
    static size_t OnWrite(char* data, size_t size, size_t n, void* self)
    {
        return static_cast<Impl*>(self)->Write(data, size * n);
    }
    static size_t OnRead(char* data, size_t size, size_t n, void* self)
    {
        return static_cast<Impl*>(self)->Read(data, size * n);
    }

    size_t Header(const char* data, size_t len)
    {
        if (headerBlock.size() + len > kMaxHeaderBlock) {
            headerTooLarge = true;
            return 0;
        }
        std::string line(data, len);
        while (!line.empty() && (line.back() == '\n' || line.back() == '\r')) {
            line.pop_back();
        }
        if (StartsWithNoCase(line, "HTTP/")) {
            // A new answer (after "100 Continue"): forget the previous one.
            headerBlock.clear();
            contentType.clear(), contentLength.clear(), contentRange.clear(), disposition.clear();
            acceptRanges.clear();
        }
        headerBlock.append(data, len);
        const size_t colon = line.find(':');
        if (colon == std::string::npos) {
            return len;
        }
        std::string name = line.substr(0, colon);
        std::string value = line.substr(colon + 1);
        value.erase(0, value.find_first_not_of(" \t"));
        if (!SafeHeaderValue(value)) {
            return len;  // not passed on
        }
        const struct {
            const char* name;
            std::string& field;
        } kept[] = {{"Content-Type", contentType},
                    {"Content-Length", contentLength},
                    {"Content-Range", contentRange},
                    {"Content-Disposition", disposition},
                    {"Accept-Ranges", acceptRanges}};
        for (const auto& k : kept) {
            if (strcasecmp(name.c_str(), k.name) == 0) {
                k.field = value;
            }
        }
        return len;
    }

    // A file answer of the peer (its file outputer), not an answer of the
    // web API: a partial answer, a range it cannot give, or a whole answer
    // naming a file or offering ranges, that is not JSON.
    bool IsFileAnswer() const
    {
        if (StartsWithNoCase(contentType, "application/json")) {
            return false;
        }
        const bool offersRanges = strcasecmp(acceptRanges.c_str(), "bytes") == 0;
        return status == 206 || (status == 416 && !contentRange.empty()) ||
               (status == 200 && (!disposition.empty() || offersRanges));
    }

    bool WriteOut(const char* data, size_t len)
    {
        if (!System::WriteAll(request.outFd, data, len)) {
            writeFailed = true;
            return false;
        }
        return true;
    }

    bool StartStream(CURL* handle)
    {
        long code = 0;
        Relay::LazyCurl()->curl_easy_getinfo(handle, CURLINFO_RESPONSE_CODE, &code);
        status = code;
        if (request.outFd < 0 || !IsFileAnswer()) {
            mode = Mode::kBuffer;
            return true;
        }
        mode = Mode::kStream;
        streamed = true;
        std::string block;
        if (status == 206) {
            block += "Status: 206 Partial Content\r\n";
        } else if (status == 416) {
            block += "Status: 416 Range Not Satisfiable\r\n";
        }
        const struct {
            const char* name;
            const std::string& value;
        } out[] = {{"Content-Type", contentType},
                   {"Content-Length", contentLength},
                   {"Content-Range", contentRange},
                   {"Content-Disposition", disposition},
                   {"Accept-Ranges", acceptRanges}};
        for (const auto& h : out) {
            if (!h.value.empty()) {
                block += std::string(h.name) + ": " + h.value + "\r\n";
            }
        }
        block += "X-Content-Type-Options: nosniff\r\n\r\n";
        fflush(stdout);
        return WriteOut(block.data(), block.size());
    }

    size_t Write(const char* data, size_t len)
    {
        if (mode == Mode::kUndecided && !StartStream(curl)) {
            return 0;
        }
        if (mode == Mode::kStream) {
            return WriteOut(data, len) ? len : 0;
        }
        if (body.size() + len > kMaxAnswer) {
            bodyTooLarge = true;
            return 0;
        }
        body.append(data, len);
        return len;
    }

    size_t Read(char* data, size_t len)
    {
        if (toRead <= 0) {
            return 0;
        }
        const size_t want = static_cast<size_t>(std::min<long long>(toRead, static_cast<long long>(len)));
        for (;;) {
            const ssize_t got = read(request.bodyFd, data, want);
            if (got > 0) {
                toRead -= got;
                return static_cast<size_t>(got);
            }
            if (got < 0 && errno == EINTR) {
                continue;
            }
            readFailed = true;  // the client's body ended early or broke
            return CURL_READFUNC_ABORT;
        }
    }

    void MapCurlError(CURLcode rc)
    {
        const char* text = Relay::LazyCurl()->curl_easy_strerror(rc);
        const std::string why = text != nullptr ? text : "libcurl error";
        if (headerTooLarge) {
            Fail(kBadAnswer, "answer headers too large");
        } else if (bodyTooLarge) {
            Fail(kTooLarge, "answer larger than " + std::to_string(kMaxAnswer) + " bytes");
        } else if (readFailed) {
            Fail(kTransfer, "request body could not be read");
        } else if (writeFailed) {
            Fail(kTransfer, "answer could not be written");
        } else if (rc == CURLE_OPERATION_TIMEDOUT) {
            Fail(kTimeout, why);
        } else if (rc == CURLE_COULDNT_CONNECT || rc == CURLE_COULDNT_RESOLVE_HOST || rc == CURLE_SEND_ERROR ||
                   rc == CURLE_RECV_ERROR || rc == CURLE_GOT_NOTHING) {
            Fail(kConnect, why);
        } else if (rc == CURLE_PEER_FAILED_VERIFICATION || rc == CURLE_SSL_CONNECT_ERROR ||
                   rc == CURLE_SSL_PINNEDPUBKEYNOTMATCH || rc == CURLE_SSL_CACERT_BADFILE ||
                   rc == CURLE_SSL_CERTPROBLEM) {
            Fail(kTls, why);
        } else {
            Fail(kTransfer, why);
        }
    }

    bool Run();
};

bool CredRequestMgr::Impl::Run()
{
    if (!added) {
        if (error == kOk) {
            Fail(kBadRequest, "no request added");
        }
        return false;
    }
    added = false;
    const Relay::CurlApi* api = Relay::LazyCurl();
    if (api == nullptr) {
        Fail(kLibrary, "libcurl cannot be loaded");
        return false;
    }
    std::unique_ptr<CURL, void (*)(CURL*)> handle(api->curl_easy_init(), api->curl_easy_cleanup);
    std::unique_ptr<curl_slist, void (*)(curl_slist*)> headers(nullptr, api->curl_slist_free_all);
    if (!handle) {
        Fail(kLibrary, "curl_easy_init failed");
        return false;
    }

    // The peer's token goes in a header, never among the parameters, where
    // a handler of the peer could answer with it. A "tid" of the caller's
    // would take its place: it is dropped.
    Json::Value params = request.params;
    params.removeMember("tid");
    const bool streamBody = request.bodyFd >= 0;
    const std::string form = FormEncode(params);
    std::string url = peer.url + kEntryPath;
    if (streamBody || !request.post) {
        url += "?" + form;
    }

    auto add = [&](const std::string& line) {
        curl_slist* next = api->curl_slist_append(headers.get(), line.c_str());
        if (next != nullptr) {
            headers.release();
            headers.reset(next);
        }
        return next != nullptr;
    };
    bool ok = add("Expect:") && add("Accept: application/json, */*") &&
              add("X-Vela-Access-Token: " + peer.token);
    if (streamBody && !request.contentType.empty()) {
        ok = ok && add("Content-Type: " + request.contentType);
    }
    if (!request.range.empty()) {
        ok = ok && add("Range: " + request.range);
    }
    if (!ok) {
        Fail(kLibrary, "out of memory");
        return false;
    }

    CURL* c = handle.get();
    const long total = timeout;
    const long connect = std::min<long>(kConnectTimeout, total);
    const std::string caFile = peer.caFile.empty() ? std::string() : System::ResolvePath(peer.caFile.c_str());
    const CURLcode setup[] = {
        api->curl_easy_setopt(c, CURLOPT_URL, url.c_str()),
        api->curl_easy_setopt(c, CURLOPT_PROTOCOLS_STR, "http,https"),
        api->curl_easy_setopt(c, CURLOPT_FOLLOWLOCATION, 0L),
        // The CGI environment comes from the client (HTTP_PROXY from a
        // "Proxy:" header): no proxy is ever taken from it.
        api->curl_easy_setopt(c, CURLOPT_PROXY, ""),
        api->curl_easy_setopt(c, CURLOPT_NOPROXY, "*"),
        api->curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L),
        api->curl_easy_setopt(c, CURLOPT_CONNECTTIMEOUT, connect),
        api->curl_easy_setopt(c, CURLOPT_TIMEOUT, total),
        api->curl_easy_setopt(c, CURLOPT_SSL_VERIFYPEER, 1L),
        api->curl_easy_setopt(c, CURLOPT_SSL_VERIFYHOST, 2L),
        api->curl_easy_setopt(c, CURLOPT_HTTPHEADER, headers.get()),
        api->curl_easy_setopt(c, CURLOPT_HEADERFUNCTION, &Impl::OnHeader),
        api->curl_easy_setopt(c, CURLOPT_HEADERDATA, this),
        api->curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, &Impl::OnWrite),
        api->curl_easy_setopt(c, CURLOPT_WRITEDATA, this),
    };
    for (CURLcode rc : setup) {
        if (rc != CURLE_OK) {
            Fail(kLibrary, "libcurl refused an option");
            return false;
        }
    }
    if (!caFile.empty() && api->curl_easy_setopt(c, CURLOPT_CAINFO, caFile.c_str()) != CURLE_OK) {
        Fail(kTls, "caFile refused");
        return false;
    }
    if (!peer.pinnedPubKey.empty() &&
        api->curl_easy_setopt(c, CURLOPT_PINNEDPUBLICKEY, peer.pinnedPubKey.c_str()) != CURLE_OK) {
        Fail(kTls, "pinned public keys are not supported by libcurl");
        return false;
    }
    if (streamBody) {
        toRead = request.contentLength;
        api->curl_easy_setopt(c, CURLOPT_POST, 1L);
        api->curl_easy_setopt(c, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.contentLength));
        api->curl_easy_setopt(c, CURLOPT_READFUNCTION, &Impl::OnRead);
        api->curl_easy_setopt(c, CURLOPT_READDATA, this);
    } else if (request.post) {
        api->curl_easy_setopt(c, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(form.size()));
        api->curl_easy_setopt(c, CURLOPT_COPYPOSTFIELDS, form.c_str());
    }

    CURLcode rc = CURLE_OK;
    {
        // A client that goes away during a streamed download ends the
        // exchange (the write fails), not the process.
        System::SigpipeBlock noSigpipe;
        curl = c;
        rc = api->curl_easy_perform(c);
        curl = nullptr;
    }
    long code = 0;
    api->curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &code);
    status = code;
    if (rc != CURLE_OK) {
        MapCurlError(rc);
        return false;
    }
    // An answer without a body (an empty file, a range it cannot give) is
    // judged here: no write came to judge it.
    if (mode == Mode::kUndecided && !StartStream(c)) {
        Fail(kTransfer, "answer could not be written");
        return false;
    }
    if (mode == Mode::kStream) {
        return true;
    }
    Json::Value answer;
    if (!WebAPIUtil::ParseJson(body, answer) || !answer.isObject() || !answer["success"].isBool()) {
        Fail(kBadAnswer, "answer is not JSON of the web API (HTTP status " + std::to_string(status) + ")");
        return false;
    }
    // The token is this appliance's secret: an answer that shows it (a
    // handler of the peer echoing its environment) goes no further.
    if (body.find(peer.token) != std::string::npos) {
        Fail(kBadAnswer, "answer holds the peer's token");
        return false;
    }
    response = answer;
    return true;
}

CredRequestMgr::CredRequestMgr() : d_(new Impl) {}

CredRequestMgr::~CredRequestMgr() { delete d_; }

void CredRequestMgr::SetTimeout(int seconds) { d_->timeout = std::max(1, std::min(seconds, kMaxTimeout)); }

bool CredRequestMgr::AddRelayRequest(const std::string& peer, const RelayRequest& request)
{
    return d_->Add(peer, request);
}

bool CredRequestMgr::AddWebAPIRequest(const std::string& peer, const std::string& api, int version,
                                      const std::string& method, const Json::Value& params)
{
    if (!System::IsAPIName(api) || !System::IsCheckedName(method, System::kNameDotted, System::kMaxAPIName) ||
        version < 1 || (!params.isNull() && !params.isObject())) {
        d_->Fail(kBadRequest, "invalid api, version, method or parameters");
        return false;
    }
    RelayRequest request;
    if (params.isObject()) {
        request.params = params;
    }
    request.params["api"] = api;
    request.params["version"] = std::to_string(version);
    request.params["method"] = method;
    request.post = true;
    return d_->Add(peer, request);
}

bool CredRequestMgr::Run()
{
    try {
        return d_->Run();
    } catch (const std::exception& e) {
        d_->Fail(kTransfer, std::string("internal error: ") + e.what());
        return false;
    }
}

const Json::Value& CredRequestMgr::GetResponse() const { return d_->response; }

int CredRequestMgr::GetError() const { return d_->error; }

const std::string& CredRequestMgr::GetErrorText() const { return d_->errorText; }

long CredRequestMgr::GetHTTPStatus() const { return d_->status; }

bool CredRequestMgr::Streamed() const { return d_->streamed; }

}  // namespace VELA
