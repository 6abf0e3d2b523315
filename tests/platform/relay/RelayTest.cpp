// Peers of the relay and the request manager, short of a real exchange
// (tests/e2e/relay.sh relays between two servers): what a peer may be, the
// peers file and its refusals, the manager's refusals before it contacts
// anyone, and libcurl mapped only by a process that relays.
#include <sys/stat.h>
#include <unistd.h>

#include "platform/PlatformTest.h"
#include "vela/relay.h"
#include "webapi/APIRequest.h"

namespace {

using namespace VELA::Test;
using VELA::CredRequestMgr;
using VELA::RelayPeer;
namespace Relay = VELA::Relay;

bool CurlMapped() { return ReadText("/proc/self/maps").find("libcurl") != std::string::npos; }

RelayPeer Peer(const std::string& name, const std::string& url, const std::string& token = "abc.DEF-1_x")
{
    RelayPeer p;
    p.name = name;
    p.url = url;
    p.token = token;
    return p;
}

// With VELA_RELAY_PROBE set, the program builds a plain request, reports
// whether libcurl is mapped, relays to a peer that is down (VELA_ROOT holds
// its peers file), reports the manager's error and the mapping again, and
// exits before any test runs.
[[maybe_unused]] const bool g_probe = [] {
    if (getenv("VELA_RELAY_PROBE") == nullptr) {
        return false;
    }
    Json::Value request(Json::objectValue);
    request["environ"]["REMOTE_ADDR"] = "127.0.0.1";
    request["getParam"]["relay_ds"] = "down";
    VELA::APIRequest plain(request);
    std::vector<RelayPeer> peers;
    std::string why;
    const bool read = Relay::LoadPeers(peers, why);
    printf("plain=%d peers=%d\n", CurlMapped() ? 1 : 0, read ? static_cast<int>(peers.size()) : -1);
    CredRequestMgr mgr;
    mgr.SetTimeout(5);
    const bool ran = mgr.AddWebAPIRequest("down", "VELA.Sample", 1, "echo", Json::Value()) && mgr.Run();
    printf("ran=%d error=%d curl=%d\n", ran ? 1 : 0, mgr.GetError(), CurlMapped() ? 1 : 0);
    fflush(stdout);
    _exit(0);
}();

TEST(RelayPeer, WhatAPeerMayBe)
{
    const std::string longName(Relay::kMaxPeerName + 1, 'a');
    const struct {
        RelayPeer peer;
        const char* refusal;  // a part of `why`; null: accepted
    } cases[] = {
        {Peer("backup", "https://nas2.example.com"), nullptr},
        {Peer("b-2_x.y", "https://10.0.0.2:5001"), nullptr},
        {Peer("local", "http://127.0.0.2:8080"), nullptr},
        {Peer("local6", "http://[::1]:8080"), nullptr},
        {Peer(std::string(Relay::kMaxPeerName, 'a'), "https://[2001:db8::1]"), nullptr},
        {Peer("", "https://a"), "peer name"},
        {Peer(".hidden", "https://a"), "peer name"},
        {Peer("a/b", "https://a"), "peer name"},
        {Peer("../x", "https://a"), "peer name"},
        {Peer(longName, "https://a"), "peer name"},
        {Peer("p", "ftp://a"), "https:// or http://"},
        {Peer("p", "HTTPS://a"), "https:// or http://"},
        {Peer("p", "http://10.0.0.2"), "loopback"},
        {Peer("p", "http://localhost"), "loopback"},
        {Peer("p", "http://127.0.0.1.evil.example"), "loopback"},
        {Peer("p", "http://[::ffff:10.0.0.1]"), "loopback"},
        {Peer("p", "https://a..b"), "host name"},
        {Peer("p", "https://.a"), "host name"},
        {Peer("p", "https://"), "host name"},
        {Peer("p", "https://user@host"), "nothing else"},
        {Peer("p", "https://host/path"), "nothing else"},
        {Peer("p", "https://host?x=1"), "nothing else"},
        {Peer("p", "https://host:0"), "port"},
        {Peer("p", "https://host:65536"), "port"},
        {Peer("p", "https://host:+443"), "port"},
        {Peer("p", "https://host:443/x"), "port"},
        {Peer("p", "https://[::1"), "unterminated"},
        {Peer("p", "https://[nonsense]"), "IPv6"},
        {Peer("p", std::string("http://[::1\0]:80", 16)), "IPv6"},
        {Peer("p", std::string("http://127.0.0.1\0.evil", 22)), "nothing else"},
        {Peer("p", "https://" + std::string(300, 'a')), "url must be"},
        {Peer("p", "https://a", ""), "token"},
        {Peer("p", "https://a", "a b"), "token"},
        {Peer("p", "https://a", "a\r\nX-Evil: 1"), "token"},
        {Peer("p", "https://a", std::string(Relay::kMaxPeerToken + 1, 'a')), "token"},
    };
    for (const auto& c : cases) {
        std::string why;
        const bool ok = Relay::CheckPeer(c.peer, why);
        EXPECT_EQ(c.refusal == nullptr, ok) << c.peer.name << " " << c.peer.url << ": " << why;
        if (c.refusal != nullptr) {
            EXPECT_NE(std::string::npos, why.find(c.refusal)) << c.peer.url << ": " << why;
            EXPECT_EQ(std::string::npos, why.find(c.peer.token.empty() ? "\x01" : c.peer.token))
                << "the token is quoted: " << why;
        }
    }

    RelayPeer tls = Peer("tls", "https://a");
    std::string why;
    tls.caFile = "/etc/vela/peers/a.pem";
    tls.pinnedPubKey = "sha256//AbC+/=;sha256//x";
    EXPECT_TRUE(Relay::CheckPeer(tls, why)) << why;
    for (const char* bad : {"a.pem", "/etc/../shadow", "/etc/vela/..", "/a\nb"}) {
        tls.caFile = bad;
        EXPECT_FALSE(Relay::CheckPeer(tls, why)) << bad;
    }
    tls.caFile = "";
    for (const char* bad : {"sha1//abc", "sha256//", "sha256//a b"}) {
        tls.pinnedPubKey = bad;
        EXPECT_FALSE(Relay::CheckPeer(tls, why)) << bad;
    }
    RelayPeer plain = Peer("plain", "http://127.0.0.1:8080");
    plain.caFile = "/etc/vela/peers/a.pem";
    EXPECT_FALSE(Relay::CheckPeer(plain, why));
    EXPECT_NE(std::string::npos, why.find("need https"));
}

class PeersFile : public RootTest {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the peers file must belong to root";
        }
    }
    std::string Path() const { return In("/etc/vela/peers.json"); }
    bool Load(std::string& why)
    {
        std::vector<RelayPeer> peers;
        const bool ok = Relay::LoadPeers(peers, why);
        EXPECT_TRUE(ok || peers.empty());
        return ok;
    }
};

TEST_F(PeersFile, SavedRootOnlyReadBackAndLookedUp)
{
    std::vector<RelayPeer> peers;
    std::string why;
    EXPECT_TRUE(Relay::LoadPeers(peers, why)) << "a missing file is no peer: " << why;
    EXPECT_TRUE(peers.empty());

    RelayPeer a = Peer("a", "https://10.0.0.2:5001", "id1.secret1");
    a.caFile = "/etc/vela/a.pem";
    const RelayPeer b = Peer("b", "http://127.0.0.2:80", "id2.secret2");
    ASSERT_TRUE(Relay::SavePeers({a, b}, why)) << why;
    struct stat st {};
    ASSERT_EQ(0, lstat(Path().c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 07777);
    EXPECT_EQ(0u, st.st_uid);

    ASSERT_TRUE(Relay::LoadPeers(peers, why)) << why;
    ASSERT_EQ(2u, peers.size());
    RelayPeer found;
    ASSERT_EQ(1, Relay::FindPeer("a", found, why));
    EXPECT_EQ(a.url, found.url);
    EXPECT_EQ(a.token, found.token);
    EXPECT_EQ(a.caFile, found.caFile);
    ASSERT_EQ(1, Relay::FindPeer("b", found, why));
    EXPECT_EQ("id2.secret2", found.token);
    for (const char* name : {"c", "", "../etc/passwd", "A", "a "}) {
        EXPECT_EQ(0, Relay::FindPeer(name, found, why)) << name;
    }

    // An invalid peer is never written; the file stays as it was.
    EXPECT_FALSE(Relay::SavePeers({a, Peer("c", "http://10.0.0.3")}, why));
    ASSERT_TRUE(Relay::LoadPeers(peers, why));
    EXPECT_EQ(2u, peers.size());
}

TEST_F(PeersFile, RefusedUnlessRootOnlyAndValid)
{
    std::string why;
    ASSERT_TRUE(Relay::SavePeers({Peer("a", "https://a")}, why)) << why;
    const std::string good = ReadText(Path());

    for (mode_t mode : {0640, 0604, 0644, 0400, 0700}) {
        ASSERT_EQ(0, chmod(Path().c_str(), mode));
        EXPECT_FALSE(Load(why)) << std::oct << mode;
        EXPECT_NE(std::string::npos, why.find("mode 0600")) << why;
        RelayPeer p;
        EXPECT_EQ(-1, Relay::FindPeer("a", p, why));
    }
    ASSERT_EQ(0, chmod(Path().c_str(), 0600));
    ASSERT_EQ(0, chown(Path().c_str(), 65534, 0));
    EXPECT_FALSE(Load(why)) << "a file of another owner was read";
    ASSERT_EQ(0, chown(Path().c_str(), 0, 0));
    EXPECT_TRUE(Load(why)) << why;

    // A link to a root-only file is not followed; a directory is no file.
    WriteFile(In("/etc/vela/real.json"), good, 0600);
    ASSERT_EQ(0, unlink(Path().c_str()));
    ASSERT_EQ(0, symlink(In("/etc/vela/real.json").c_str(), Path().c_str()));
    EXPECT_FALSE(Load(why));
    ASSERT_EQ(0, unlink(Path().c_str()));
    ASSERT_EQ(0, mkdir(Path().c_str(), 0700));
    EXPECT_FALSE(Load(why));
    ASSERT_EQ(0, rmdir(Path().c_str()));

    const std::string bad[] = {
        "not json",
        "[]",
        "{\"peers\": []}",
        "{\"peers\": {\"a\": \"https://a\"}}",
        "{\"peers\": {\"a\": {\"url\": \"https://a\"}}}",
        "{\"peers\": {\"a\": {\"url\": \"https://a\", \"token\": 5}}}",
        "{\"peers\": {\"../a\": {\"url\": \"https://a\", \"token\": \"t\"}}}",
        "{\"peers\": {\"a\": {\"url\": \"http://10.1.1.1\", \"token\": \"t\"}}}",
        std::string(300 << 10, ' ') + "{}",
    };
    for (const std::string& text : bad) {
        WriteFile(Path(), text, 0600);
        EXPECT_FALSE(Load(why)) << text.substr(0, 80);
    }
}

TEST_F(PeersFile, ManagerRefusesBeforeContactingAnyone)
{
    std::string why;
    ASSERT_TRUE(Relay::SavePeers({Peer("a", "http://127.0.0.1:1")}, why)) << why;
    {
        CredRequestMgr mgr;
        EXPECT_FALSE(mgr.Run());
        EXPECT_EQ(CredRequestMgr::kBadRequest, mgr.GetError());
    }
    const struct {
        const char* peer;
        const char* api;
        int version;
        const char* method;
        int error;
    } cases[] = {
        {"nosuch", "VELA.Sample", 1, "echo", CredRequestMgr::kUnknownPeer},
        {"../a", "VELA.Sample", 1, "echo", CredRequestMgr::kUnknownPeer},
        {"a", "../VELA", 1, "echo", CredRequestMgr::kBadRequest},
        {"a", "VELA.Sample", 0, "echo", CredRequestMgr::kBadRequest},
        {"a", "VELA.Sample", 1, "a&b=c", CredRequestMgr::kBadRequest},
    };
    for (const auto& c : cases) {
        CredRequestMgr mgr;
        EXPECT_FALSE(mgr.AddWebAPIRequest(c.peer, c.api, c.version, c.method, Json::Value()));
        EXPECT_FALSE(mgr.Run());
        EXPECT_EQ(c.error, mgr.GetError()) << c.peer << " " << c.api << " " << c.method;
        EXPECT_TRUE(mgr.GetResponse().isNull());
    }
    {
        CredRequestMgr mgr;
        ASSERT_TRUE(mgr.AddWebAPIRequest("a", "VELA.Sample", 1, "echo", Json::Value()));
        EXPECT_FALSE(mgr.AddWebAPIRequest("a", "VELA.Sample", 1, "echo", Json::Value()));
        EXPECT_EQ(CredRequestMgr::kBadRequest, mgr.GetError());
        CredRequestMgr::RelayRequest header;
        header.range = "bytes=0-1\r\nX-Evil: 1";
        CredRequestMgr other;
        EXPECT_FALSE(other.AddRelayRequest("a", header));
        EXPECT_EQ(CredRequestMgr::kBadRequest, other.GetError());
    }
    ASSERT_EQ(0, chmod(Path().c_str(), 0644));
    CredRequestMgr mgr;
    EXPECT_FALSE(mgr.AddWebAPIRequest("a", "VELA.Sample", 1, "echo", Json::Value()));
    EXPECT_EQ(CredRequestMgr::kPeersFile, mgr.GetError());
    EXPECT_FALSE(CurlMapped()) << "libcurl was loaded without an exchange";
}

TEST_F(PeersFile, LibcurlOnlyInAProcessThatRelays)
{
    std::string why;
    ASSERT_TRUE(Relay::SavePeers({Peer("down", "http://127.0.0.1:1")}, why)) << why;
    Ran ran = RunTool({"/proc/self/exe"}, {{"VELA_RELAY_PROBE", "1"}});
    EXPECT_EQ("plain=0 peers=1\nran=0 error=" + std::to_string(CredRequestMgr::kConnect) + " curl=1\n", ran.out)
        << ran.err;
    TempDir libs;
    WriteFile(libs.Path() + "/libcurl.so.4", "not a library");
    ran = RunTool({"/proc/self/exe"}, {{"VELA_RELAY_PROBE", "1"}, {"LD_LIBRARY_PATH", libs.Path()}});
    EXPECT_EQ("plain=0 peers=1\nran=0 error=" + std::to_string(CredRequestMgr::kLibrary) + " curl=0\n", ran.out)
        << ran.err;
}

}  // namespace
