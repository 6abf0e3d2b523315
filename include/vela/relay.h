// Relaying web-API calls to peer appliances.
//
// Peers are named by the administrator in <root>/etc/vela/peers.json, a file
// owned by root with mode 0600 (anything else is refused):
//
//   {"peers": {"backup": {"url": "https://10.0.0.2:5001",
//                         "token": "<access token issued by the peer>",
//                         "caFile": "/etc/vela/peers/backup.pem",
//                         "pinnedPubKey": "sha256//<base64>"}}}
//
// "url" is the peer's base URL (scheme, host, optional port, nothing else);
// calls go to <url>/webapi/entry.cgi. "https" is always verified against
// the system's authorities, or "caFile" (an absolute path under the system
// root) when given; "pinnedPubKey" additionally pins the peer's public key.
// "http" is accepted only for a loopback address (127.0.0.0/8, ::1), for
// peers on the same machine. "token" is an access token the peer issued
// (velaadm token create there); the call on the peer runs as its user. The
// token is never logged nor shown: it travels in the header
// X-Vela-Access-Token, and a JSON answer that holds it is refused.
//
// A client names a peer, never a URL: nothing a client sends makes the
// server contact an address the administrator did not write down.
#pragma once

#include <json/json.h>
#include <string>
#include <vector>

#include "vela/export.h"

namespace VELA {

struct RelayPeer {
    std::string name;
    std::string url;           // scheme://host[:port]
    std::string token;         // access token presented to the peer
    std::string caFile;        // "" : the system's authorities
    std::string pinnedPubKey;  // "" : no pin ("sha256//<base64>" otherwise)
};

// The application privilege a caller needs to relay a call to a peer.
// Administrators hold every application privilege; others are granted it in
// /etc/vela/app_privileges.json like any other.
constexpr const char kRelayPrivilege[] = "VELA.Relay";

#pragma GCC visibility push(default)
namespace Relay {

constexpr size_t kMaxPeerName = 64;
constexpr size_t kMaxPeerURL = 256;
constexpr size_t kMaxPeerToken = 512;
constexpr size_t kMaxPeers = 256;

// A peer name: 1 to kMaxPeerName letters, digits, ".", "_", "-", not
// starting with ".".
bool IsPeerName(const std::string& name);

// Whether `peer` may be stored and used: a valid name, URL, token, CA file
// and pin as described above. False with `why` set (never quoting the
// token).
bool CheckPeer(const RelayPeer& peer, std::string& why);

// The resolved path of the peers file.
std::string PeersPath();

// Reads every peer. A missing file is no peer (true, empty list). False
// with `why` set when the file is not a regular file owned by root with
// mode 0600, is larger than 256 KiB, is not valid, or holds an invalid peer.
bool LoadPeers(std::vector<RelayPeer>& peers, std::string& why);

// The peer named `name`: 1 found, 0 no such peer (or `name` is not a peer
// name), -1 the file is refused (`why` set).
int FindPeer(const std::string& name, RelayPeer& peer, std::string& why);

// Replaces the peers file with `peers` (each checked first): written to a
// temporary file (root, 0600) renamed over the old one. False with `why`.
bool SavePeers(const std::vector<RelayPeer>& peers, std::string& why);

}  // namespace Relay
#pragma GCC visibility pop

// One HTTP exchange with a peer, through libcurl (loaded on first use by the
// process that relays; no other process maps it).
//
//   CredRequestMgr mgr;
//   mgr.SetTimeout(30);
//   if (!mgr.AddWebAPIRequest("backup", "VELA.Sample", 1, "echo", params) || !mgr.Run()) {
//       log(mgr.GetError(), mgr.GetErrorText());
//   }
//   Json::Value answer = mgr.GetResponse();  // the peer's JSON answer
//
// One request per manager: a second Add*Request before Run fails. Run
// answers true when the peer answered with JSON (success or an error code of
// its own: the answer is passed on as it is) or, for a relayed download,
// when the answer was streamed to the output descriptor.
class VELA_EXPORT CredRequestMgr {
public:
    enum Error {
        kOk = 0,
        kBadRequest = 1,    // no request added, or a second one; invalid arguments
        kUnknownPeer = 2,   // no peer of that name
        kPeersFile = 3,     // the peers file is refused
        kLibrary = 4,       // libcurl cannot be loaded
        kConnect = 5,       // the peer cannot be reached (refused, no route, DNS)
        kTimeout = 6,       // the peer did not answer in time
        kTls = 7,           // certificate or pinned key refused
        kBadAnswer = 8,     // the answer is not JSON of the web API
        kTooLarge = 9,      // the JSON answer exceeds kMaxAnswer
        kTransfer = 10,     // the exchange broke off (body read or write failed)
    };

    // A JSON answer larger than this is refused (kTooLarge).
    static constexpr size_t kMaxAnswer = 4u << 20;
    static constexpr int kDefaultTimeout = 60;
    static constexpr int kMaxTimeout = 3600;
    static constexpr int kConnectTimeout = 10;

    // A request relayed as it came. Its parameters (a "tid" among them is
    // dropped: the peer's token goes in a header) are the form body of a
    // POST when `post` is set and no body is given, else the query string;
    // a body, when `bodyFd` >= 0, streams from that descriptor
    // (`contentLength` bytes, with `contentType`). `range` is forwarded as
    // the Range header. When `outFd` >= 0, a file answer of the peer (206,
    // 416 with Content-Range, or 200 with Content-Disposition or
    // "Accept-Ranges: bytes", not JSON) streams to it as a CGI answer
    // (Status, Content-Type, Content-Length, Content-Range,
    // Content-Disposition, Accept-Ranges, then the body); any other answer
    // must be JSON of the web API (kBadAnswer otherwise).
    struct RelayRequest {
        Json::Value params = Json::Value(Json::objectValue);  // name -> value
        bool post = false;        // form POST of `params` (no body given)
        int bodyFd = -1;
        long long contentLength = -1;
        std::string contentType;
        std::string range;
        int outFd = -1;
    };

    CredRequestMgr();
    ~CredRequestMgr();
    CredRequestMgr(const CredRequestMgr&) = delete;
    CredRequestMgr& operator=(const CredRequestMgr&) = delete;

    // The total time limit of Run, 1 to kMaxTimeout seconds (clamped); the
    // connection must be made within kConnectTimeout of it.
    void SetTimeout(int seconds);

    // Relays `request` to peer `peer`; the peer's access token is added.
    bool AddRelayRequest(const std::string& peer, const RelayRequest& request);
    // Calls api/version/method on peer `peer` with `params` (an object),
    // sent as a form POST.
    bool AddWebAPIRequest(const std::string& peer, const std::string& api, int version, const std::string& method,
                          const Json::Value& params);

    bool Run();

    // The peer's JSON answer (null until Run succeeded, or after a stream).
    const Json::Value& GetResponse() const;
    // An Error; kOk when nothing failed.
    int GetError() const;
    // A short reason for logs and answers (never the token).
    const std::string& GetErrorText() const;
    // The peer's HTTP status, 0 before an answer.
    long GetHTTPStatus() const;
    // Whether Run streamed a download to the output descriptor.
    bool Streamed() const;

private:
    struct Impl;
    Impl* d_;
};

}  // namespace VELA
