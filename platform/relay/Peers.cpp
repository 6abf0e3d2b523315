// The peers file <root>/etc/vela/peers.json: read (root-only, bounded,
// checked), looked up and replaced atomically.
#include <arpa/inet.h>
#include <cerrno>
#include <cstring>
#include <sys/stat.h>

#include "system/FileUtil.h"
#include "system/SysInternal.h"
#include "vela/relay.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace VELA {
namespace Relay {

namespace {

const char kPeersFile[] = "/etc/vela/peers.json";
const size_t kMaxPeersFile = 256u << 10;
const size_t kMaxCAPath = 1024;
const size_t kMaxPin = 512;

bool IsHostChar(char c) { return isalnum(static_cast<unsigned char>(c)) || c == '-' || c == '.'; }

// "scheme://host[:port]": host a DNS name, a dotted IPv4 address or a
// bracketed IPv6 address; port 1 to 65535. `loopback` tells whether the
// host is a loopback address literal.
bool ParseURL(const std::string& url, bool& https, bool& loopback, std::string& why)
{
    if (url.empty() || url.size() > kMaxPeerURL) {
        why = "url must be 1 to " + std::to_string(kMaxPeerURL) + " bytes";
        return false;
    }
    size_t at = 0;
    if (url.compare(0, 8, "https://") == 0) {
        https = true;
        at = 8;
    } else if (url.compare(0, 7, "http://") == 0) {
        https = false;
        at = 7;
    } else {
        why = "url must start with https:// or http://";
        return false;
    }
    std::string host;
    size_t end = at;
    if (at < url.size() && url[at] == '[') {
        end = url.find(']', at);
        if (end == std::string::npos) {
            why = "url has an unterminated [address]";
            return false;
        }
        host = url.substr(at + 1, end - at - 1);
        in6_addr a6{};
        // inet_pton stops at a NUL: every byte is judged first.
        if (host.size() > INET6_ADDRSTRLEN || host.find_first_not_of("0123456789abcdefABCDEF:.") != std::string::npos ||
            inet_pton(AF_INET6, host.c_str(), &a6) != 1) {
            why = "url has an invalid IPv6 address";
            return false;
        }
        loopback = IN6_IS_ADDR_LOOPBACK(&a6);
        ++end;
    } else {
        while (end < url.size() && IsHostChar(url[end])) {
            ++end;
        }
        host = url.substr(at, end - at);
        if (host.empty() || host.front() == '.' || host.front() == '-' || host.find("..") != std::string::npos) {
            why = "url has an invalid host name";
            return false;
        }
        in_addr a4{};
        loopback = inet_pton(AF_INET, host.c_str(), &a4) == 1 && (ntohl(a4.s_addr) >> 24) == 127;
    }
    if (end < url.size() && url[end] == ':') {
        long long port = 0;
        const std::string digits = url.substr(end + 1);
        if (!System::ParseDecimal(digits.c_str(), digits.size(), 1, 65535, port)) {
            why = "url has an invalid port";
            return false;
        }
        end = url.size();
    }
    if (end != url.size()) {
        why = "url must be scheme://host[:port] and nothing else";
        return false;
    }
    return true;
}

bool IsCAPath(const std::string& path)
{
    if (path.empty() || path.size() > kMaxCAPath || path.front() != '/' || path.find("/../") != std::string::npos ||
        path.compare(path.size() >= 3 ? path.size() - 3 : 0, 3, "/..") == 0) {
        return false;
    }
    for (char c : path) {
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
            return false;
        }
    }
    return true;
}

bool IsPin(const std::string& pin)
{
    if (pin.size() <= 8 || pin.size() > kMaxPin || pin.compare(0, 8, "sha256//") != 0) {
        return false;
    }
    for (char c : pin) {
        if (!isalnum(static_cast<unsigned char>(c)) && strchr("+/=;", c) == nullptr) {
            return false;
        }
    }
    return true;
}

bool PeerFromJson(const std::string& name, const Json::Value& v, RelayPeer& peer, std::string& why)
{
    if (!v.isObject()) {
        why = "peer \"" + name + "\" is not an object";
        return false;
    }
    const struct {
        const char* key;
        std::string& field;
        bool required;
    } fields[] = {{"url", peer.url, true},
                  {"token", peer.token, true},
                  {"caFile", peer.caFile, false},
                  {"pinnedPubKey", peer.pinnedPubKey, false}};
    peer.name = name;
    for (const auto& f : fields) {
        const Json::Value* member = v.find(f.key, f.key + strlen(f.key));
        if (member == nullptr && !f.required) {
            continue;
        }
        if (member == nullptr || !member->isString()) {
            why = std::string("peer \"") + (IsPeerName(name) ? name : "?") + "\": \"" + f.key + "\" must be a string";
            return false;
        }
        f.field = member->asString();
    }
    return CheckPeer(peer, why);
}

}  // namespace

bool IsPeerName(const std::string& name)
{
    return !name.empty() && name.front() != '.' && System::IsCheckedName(name, System::kNameDotted, kMaxPeerName);
}

bool CheckPeer(const RelayPeer& peer, std::string& why)
{
    if (!IsPeerName(peer.name)) {
        why = "a peer name is 1 to " + std::to_string(kMaxPeerName) +
              " letters, digits, '.', '_', '-', not starting with '.'";
        return false;
    }
    const std::string who = "peer \"" + peer.name + "\": ";
    bool https = false;
    bool loopback = false;
    if (!ParseURL(peer.url, https, loopback, why)) {
        why = who + why;
        return false;
    }
    if (!https && !loopback) {
        why = who + "plain http only to a loopback address (127.0.0.0/8, [::1])";
        return false;
    }
    if (!System::IsCheckedName(peer.token, System::kNameDotted, kMaxPeerToken)) {
        why = who + "the token must be an access token of the peer (letters, digits, '.', '_', '-')";
        return false;
    }
    if (!peer.caFile.empty() && !IsCAPath(peer.caFile)) {
        why = who + "caFile must be an absolute path without \"..\"";
        return false;
    }
    if (!peer.pinnedPubKey.empty() && !IsPin(peer.pinnedPubKey)) {
        why = who + "pinnedPubKey must be sha256//<base64>";
        return false;
    }
    if (!https && (!peer.caFile.empty() || !peer.pinnedPubKey.empty())) {
        why = who + "caFile and pinnedPubKey need https";
        return false;
    }
    return true;
}

std::string PeersPath() { return System::ResolvePath(kPeersFile); }

bool LoadPeers(std::vector<RelayPeer>& peers, std::string& why)
{
    peers.clear();
    const std::string path = PeersPath();
    std::string text;
    int err = 0;
    struct stat st {};
    if (!System::ReadFileBounded(path, kMaxPeersFile, text, err, System::kReadNoFollow, &st)) {
        if (err == ENOENT) {
            return true;
        }
        why = path + ": " + (err == EFBIG ? "larger than 256 KiB" : err == ELOOP ? "a symbolic link" : strerror(err));
        return false;
    }
    // Judged on the file that was read (its descriptor), not on the name.
    if (st.st_uid != 0 || (st.st_mode & 07777) != 0600) {
        why = path + ": must be owned by root with mode 0600";
        return false;
    }
    Json::Value doc;
    if (!WebAPIUtil::ParseJson(text, doc) || !doc.isObject() || !doc["peers"].isObject()) {
        why = path + ": not {\"peers\": {...}}";
        return false;
    }
    const Json::Value& list = doc["peers"];
    if (list.size() > kMaxPeers) {
        why = path + ": more than " + std::to_string(kMaxPeers) + " peers";
        return false;
    }
    for (auto it = list.begin(); it != list.end(); ++it) {
        RelayPeer peer;
        if (!PeerFromJson(it.name(), *it, peer, why)) {
            peers.clear();
            why = path + ": " + why;
            return false;
        }
        peers.push_back(peer);
    }
    return true;
}

int FindPeer(const std::string& name, RelayPeer& peer, std::string& why)
{
    if (!IsPeerName(name)) {
        return 0;
    }
    std::vector<RelayPeer> peers;
    if (!LoadPeers(peers, why)) {
        return -1;
    }
    for (const RelayPeer& p : peers) {
        if (p.name == name) {
            peer = p;
            return 1;
        }
    }
    return 0;
}

bool SavePeers(const std::vector<RelayPeer>& peers, std::string& why)
{
    if (peers.size() > kMaxPeers) {
        why = "more than " + std::to_string(kMaxPeers) + " peers";
        return false;
    }
    Json::Value doc(Json::objectValue);
    doc["peers"] = Json::Value(Json::objectValue);
    for (const RelayPeer& p : peers) {
        if (!CheckPeer(p, why)) {
            return false;
        }
        Json::Value v(Json::objectValue);
        v["url"] = p.url;
        v["token"] = p.token;
        if (!p.caFile.empty()) {
            v["caFile"] = p.caFile;
        }
        if (!p.pinnedPubKey.empty()) {
            v["pinnedPubKey"] = p.pinnedPubKey;
        }
        doc["peers"][p.name] = v;
    }
    const std::string path = PeersPath();
    if (path.empty() || !System::MakeDirs(System::DirName(path), 0755)) {
        why = "cannot make the directory of " + path;
        return false;
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    const std::string text = Json::writeString(builder, doc) + "\n";
    const char* step = "";
    if (!System::WriteFileAtomic(path, text.data(), text.size(), 0600, 0, 0, step)) {
        why = path + ": " + step + " failed: " + strerror(errno);
        return false;
    }
    return true;
}

}  // namespace Relay
}  // namespace VELA
