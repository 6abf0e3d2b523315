// Fuzz target: a peer as the administrator's tools or the peers file give
// it (name, URL, token, CA file and pin, one per line) through the peer
// check. An accepted peer must hold nothing that could leave the URL it
// names: no control byte, no blank, no "@" or path after the host; plain
// http only to a loopback address.
#include <arpa/inet.h>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "vela/relay.h"

namespace {

bool HasByte(const std::string& text, bool (*bad)(unsigned char))
{
    for (unsigned char c : text) {
        if (bad(c)) {
            return true;
        }
    }
    return false;
}

// The host part of "host[:port]" is a loopback address literal.
bool Loopback(const std::string& hostPort)
{
    if (!hostPort.empty() && hostPort[0] == '[') {
        const std::string v6 = hostPort.substr(1, hostPort.find(']') - 1);
        in6_addr a{};
        return inet_pton(AF_INET6, v6.c_str(), &a) == 1 && IN6_IS_ADDR_LOOPBACK(&a);
    }
    const std::string v4 = hostPort.substr(0, hostPort.find(':'));
    in_addr a{};
    return inet_pton(AF_INET, v4.c_str(), &a) == 1 && (ntohl(a.s_addr) >> 24) == 127;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string raw(reinterpret_cast<const char*>(data), size);
    std::string fields[5];
    size_t at = 0;
    for (std::string& field : fields) {
        const size_t nl = raw.find('\n', at);
        field = raw.substr(at, nl == std::string::npos ? std::string::npos : nl - at);
        at = nl == std::string::npos ? raw.size() : nl + 1;
    }
    VELA::RelayPeer peer;
    peer.name = fields[0];
    peer.url = fields[1];
    peer.token = fields[2];
    peer.caFile = fields[3];
    peer.pinnedPubKey = fields[4];
    std::string why;
    if (!VELA::Relay::CheckPeer(peer, why)) {
        // Every refusal says why, never quoting the token (one long enough
        // not to be some word of the message or another field).
        const bool tokenLike = peer.token.size() >= 16 && peer.token.find_first_not_of(
            "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-") == std::string::npos;
        bool elsewhere = false;
        for (const std::string* other : {&peer.name, &peer.url, &peer.caFile, &peer.pinnedPubKey}) {
            elsewhere = elsewhere || other->find(peer.token) != std::string::npos;
        }
        if (why.empty() || (tokenLike && !elsewhere && why.find(peer.token) != std::string::npos)) {
            abort();
        }
        return 0;
    }
    auto control = [](unsigned char c) { return c < 0x21 || c >= 0x7f; };
    const std::string host = peer.url.substr(peer.url.find("://") + 3);
    if (!VELA::Relay::IsPeerName(peer.name) || HasByte(peer.url, control) || HasByte(peer.token, control) ||
        host.find_first_of("@/?#\\") != std::string::npos) {
        abort();
    }
    if (peer.url.compare(0, 7, "http://") == 0 && !Loopback(host)) {
        abort();
    }
    return 0;
}
