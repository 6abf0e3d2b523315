// Sharing links against a real database under a temporary VELA_ROOT, with
// the test clock: every validation status, revocation, expiry and use
// limits, passwords and the brute-force guard, hostile texts, processes
// working at once, the sharing URL, and libsqlite3 loaded only by the
// processes that use a link.
#include "platform/session/CryptoTestUtil.h"
#include "vela/sharing.h"
#include "webapi/APIRequest.h"

namespace {

using namespace VELA::Test;
using namespace VELA::sharing;
using namespace VELA::sharing::db;

bool SqliteMapped() { return ReadText("/proc/self/maps").find("libsqlite3") != std::string::npos; }

// With VELA_SHARING_PROBE set, the program builds a plain request, reports
// whether libsqlite3 is mapped, checks a link, reports again and exits
// before any test runs.
[[maybe_unused]] const bool g_probe = [] {
    if (getenv("VELA_SHARING_PROBE") == nullptr) {
        return false;
    }
    Json::Value request(Json::objectValue);
    request["environ"]["REMOTE_ADDR"] = "127.0.0.1";
    VELA::APIRequest plain(request);
    printf("plain=%d\n", SqliteMapped() ? 1 : 0);
    printf("status=%d good=%d\n", CheckSharing("AAAAAAAAAAAAAAAAAAAAAA", "", "127.0.0.1"),
           SharingDB::Instance().IsGood() ? 1 : 0);
    EntryDB entries(SharingDB::Instance());
    LinkSpec link;
    link.projectName = "photo";
    link.path = "/volume1/a";
    link.uid = 1000;
    link.userName = "alice";
    record::Entry e;
    printf("created=%d sqlite=%d\n", entries.Create(link, e) ? 1 : 0, SqliteMapped() ? 1 : 0);
    fflush(stdout);
    _exit(0);
}();

class Sharing : public StateRootTest {
protected:
    EntryDB entries_{SharingDB::Instance()};
    SessionDB sessions_{SharingDB::Instance()};
    TokenDB tokens_{SharingDB::Instance()};

    record::Entry Link(long long expire = 0, bool matchIP = false, long long limit = 0, const std::string& pw = "")
    {
        LinkSpec link;
        link.projectName = "photo";
        link.path = "/volume1/photo/trip";
        link.uid = 1000;
        link.userName = "alice";
        link.expireTime = expire;
        link.enableMatchIP = matchIP;
        link.useLimit = limit;
        link.password = pw;
        record::Entry e;
        EXPECT_TRUE(entries_.Create(link, e));
        return e;
    }
    // Opens a visitor session; its id, "" when refused (status in `status`).
    std::string Visit(const record::Entry& e, const std::string& ip = "10.0.0.1", const std::string& pw = "",
                      int* status = nullptr)
    {
        record::Session s;
        record::Token t;
        const int rc = sessions_.Create(e.get_hash(), pw, ip, 0, s, t);
        if (status != nullptr) {
            *status = rc;
        }
        EXPECT_EQ(rc == SHARING_STATUS_VALID, !s.empty() && !t.empty());
        return s.get_session_id();
    }
};

TEST_F(Sharing, EveryValidationStatusAndTheLookups)
{
    const record::Entry a = Link(0, true), b = Link(kStart + 5000);
    ASSERT_FALSE(a.empty());
    EXPECT_EQ(22u, a.get_hash().size());
    EXPECT_NE(a.get_hash(), b.get_hash());
    const std::string sa = Visit(a, "::ffff:10.0.0.1"), sb = Visit(b, "10.0.0.9");
    ASSERT_FALSE(sa.empty());

    const std::string dir = In("/var/lib/vela/sharing");
    EXPECT_EQ(0700u, Mode(dir));
    EXPECT_EQ(0600u, Mode(dir + "/sharing.db"));
    EXPECT_EQ(1u, Names(dir).count("sharing.db-wal"));

    record::Entry e;
    record::Session s;
    record::Token t;
    ASSERT_TRUE(entries_.GetByHash(a.get_hash(), e));
    EXPECT_EQ("photo", e.get_project_name());
    EXPECT_EQ("/volume1/photo/trip", e.get_path());
    EXPECT_EQ(1000u, e.get_uid());
    EXPECT_TRUE(e.get_enable_match_ip());
    EXPECT_EQ(1, e.get_use_count());
    ASSERT_TRUE(sessions_.GetBySessionId(sa, s));
    EXPECT_EQ("10.0.0.1", s.get_client_ip());
    EXPECT_EQ(kStart + kSessionLifetimeDefault, s.get_timeout());
    EXPECT_TRUE(tokens_.GetBySessionEntry(s, e, t));
    EXPECT_EQ(sa, t.get_session_id());
    EXPECT_FALSE(tokens_.GetBySessionEntry(s, b, t));
    EXPECT_TRUE(t.empty());

    struct Case {
        std::string id, sid, ip;
        int status;
    } cases[] = {
        {a.get_hash(), sa, "10.0.0.1", SHARING_STATUS_VALID},
        {a.get_hash(), sa, "::ffff:10.0.0.1", SHARING_STATUS_VALID},
        {a.get_hash(), sa, "10.0.0.2", SHARING_STATUS_IP_MISMATCH},
        {a.get_hash(), sa, "", SHARING_STATUS_IP_MISMATCH},
        {b.get_hash(), sb, "10.9.9.9", SHARING_STATUS_VALID},  // no match-ip
        {a.get_hash(), "", "10.0.0.1", SHARING_STATUS_NO_SESSION},
        {a.get_hash(), sb, "10.0.0.1", SHARING_STATUS_NO_SESSION},  // b's session
        {a.get_hash(), "BBBBBBBBBBBBBBBBBBBBBB", "10.0.0.1", SHARING_STATUS_NO_SESSION},
        {"BBBBBBBBBBBBBBBBBBBBBB", sa, "10.0.0.1", SHARING_STATUS_NO_LINK},
        {"", sa, "10.0.0.1", SHARING_STATUS_NO_LINK},
        {a.get_hash() + "x", sa, "10.0.0.1", SHARING_STATUS_NO_LINK},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(c.status, CheckSharing(c.id, c.sid, c.ip)) << c.id << " " << c.sid << " " << c.ip;
    }
    Now() += kSessionLifetimeDefault;
    EXPECT_EQ(SHARING_STATUS_SESSION_EXPIRED, CheckSharing(a.get_hash(), sa, "10.0.0.1"));
    Now() = kStart + 5000;
    EXPECT_EQ(SHARING_STATUS_EXPIRED, CheckSharing(b.get_hash(), sb, "10.0.0.9"));
    int status = 0;
    EXPECT_EQ("", Visit(b, "10.0.0.9", "", &status));
    EXPECT_EQ(SHARING_STATUS_EXPIRED, status);
    ASSERT_TRUE(entries_.Revoke(a.get_hash()));
    EXPECT_EQ(SHARING_STATUS_REVOKED, CheckSharing(a.get_hash(), sa, "10.0.0.1"));
}

TEST_F(Sharing, RevokeEndsEverySessionAtOnce)
{
    const record::Entry a = Link(), other = Link();
    std::vector<std::string> sids;
    for (int i = 0; i < 3; ++i) {
        sids.push_back(Visit(a, "10.0.0." + std::to_string(i + 1)));
    }
    const std::string kept = Visit(other);
    ASSERT_TRUE(entries_.Revoke(a.get_hash()));
    record::Session s;
    for (const std::string& sid : sids) {
        EXPECT_FALSE(sessions_.GetBySessionId(sid, s)) << sid;
    }
    EXPECT_EQ(SHARING_STATUS_VALID, CheckSharing(other.get_hash(), kept, "10.0.0.1"));
    int status = 0;
    EXPECT_EQ("", Visit(a, "10.0.0.1", "", &status));
    EXPECT_EQ(SHARING_STATUS_REVOKED, status);
    LinkUpdate change;
    change.setUseLimit = true;
    EXPECT_FALSE(entries_.Update(a.get_hash(), change));
    EXPECT_FALSE(entries_.Revoke("BBBBBBBBBBBBBBBBBBBBBB"));
    std::vector<record::Entry> all;
    ASSERT_TRUE(entries_.ListByOwner(1000, all));
    ASSERT_EQ(2u, all.size());
    EXPECT_TRUE(all[0].is_revoked());
    EXPECT_FALSE(all[1].is_revoked());
}

TEST_F(Sharing, UseLimitExpiryAndPurge)
{
    const record::Entry e = Link(kStart + 600, false, 2);
    const std::string first = Visit(e), second = Visit(e);
    int status = 0;
    EXPECT_EQ("", Visit(e, "10.0.0.1", "", &status));
    EXPECT_EQ(SHARING_STATUS_USE_LIMIT, status);
    // The sessions that spent the uses go on; a visitor without one is told why.
    EXPECT_EQ(SHARING_STATUS_VALID, CheckSharing(e.get_hash(), second, "10.0.0.1"));
    EXPECT_EQ(SHARING_STATUS_USE_LIMIT, CheckSharing(e.get_hash(), "", "10.0.0.1"));
    LinkUpdate change;
    change.setUseLimit = true;
    change.useLimit = 3;
    ASSERT_TRUE(entries_.Update(e.get_hash(), change));
    const std::string third = Visit(e);
    ASSERT_FALSE(third.empty());
    // A session never outlives its link; expired ones are purged with their tokens.
    record::Session s;
    ASSERT_TRUE(sessions_.GetBySessionId(third, s));
    EXPECT_EQ(kStart + 600, s.get_timeout());
    change = LinkUpdate();
    change.setExpire = true;
    change.expireTime = kStart - 1;
    EXPECT_FALSE(entries_.Update(e.get_hash(), change));
    Now() += 600;
    EXPECT_EQ(0, sessions_.PurgeExpired(60));
    EXPECT_EQ(3, sessions_.PurgeExpired(0));
    EXPECT_FALSE(sessions_.GetBySessionId(first, s));
}

TEST_F(Sharing, LiveVisitorSessionsOfALinkAreBounded)
{
    // Visitors who drop their cookie and open again cannot grow the store
    // without end: a link holds the configured number of live sessions,
    // and one that ended makes room again. A refused open spends no use.
    Conf("webapi.conf", "sharing_max_sessions=2\n");
    const record::Entry e = Link(0, false, 5);
    ASSERT_FALSE(Visit(e).empty());
    Now() += 100;
    ASSERT_FALSE(Visit(e).empty());
    int status = 0;
    EXPECT_EQ("", Visit(e, "10.0.0.2", "", &status));
    EXPECT_EQ(SHARING_STATUS_BUSY, status);
    Now() += kSessionLifetimeDefault - 50;  // the first one has ended
    EXPECT_FALSE(Visit(e).empty());
    record::Entry now;
    ASSERT_TRUE(entries_.GetByHash(e.get_hash(), now));
    EXPECT_EQ(3, now.get_use_count());
}

TEST_F(Sharing, PasswordAndTheGuard)
{
    Conf("webapi.conf", "login_max_failures=\"3\"\n");
    const record::Entry e = Link(0, false, 0, "s3cret pass");
    EXPECT_TRUE(e.has_password());
    EXPECT_EQ(0u, e.get_password_hash().find("pbkdf2-sha256$600000$"));
    EXPECT_EQ(std::string::npos, e.get_password_hash().find("s3cret"));
    const std::string in = Visit(e, "10.0.0.1", "s3cret pass");
    ASSERT_FALSE(in.empty());
    int status = 0;
    for (const char* wrong : {"", "s3cret pas", "s3cret pass "}) {
        EXPECT_EQ("", Visit(e, "10.0.0.2", wrong, &status));
        EXPECT_EQ(SHARING_STATUS_BAD_PASSWORD, status) << wrong;
    }
    // The address is blocked, the right password included; others are not.
    EXPECT_EQ("", Visit(e, "10.0.0.2", "s3cret pass", &status));
    EXPECT_EQ(SHARING_STATUS_BLOCKED, status);
    EXPECT_FALSE(Visit(e, "10.0.0.3", "s3cret pass").empty());
    // A new password ends the sessions opened with the old one.
    LinkUpdate change;
    change.setPassword = true;
    change.password = "other";
    ASSERT_TRUE(entries_.Update(e.get_hash(), change));
    EXPECT_EQ(SHARING_STATUS_NO_SESSION, CheckSharing(e.get_hash(), in, "10.0.0.1"));
    EXPECT_FALSE(Visit(e, "10.0.0.1", "other").empty());
}

TEST_F(Sharing, HostileTextsAreRefusedOrStoredLiterally)
{
    const std::string sql = "x'); DROP TABLE entry; --\"";
    LinkSpec link;
    link.projectName = "photo";
    link.path = "/volume1/" + sql;
    link.uid = 1000;
    link.userName = sql;
    link.password = sql;
    record::Entry e, got;
    ASSERT_TRUE(entries_.Create(link, e));
    ASSERT_TRUE(entries_.GetByHash(e.get_hash(), got));
    EXPECT_EQ(link.path, got.get_path());
    EXPECT_EQ(sql, got.get_user_name());
    EXPECT_FALSE(Visit(e, "10.0.0.1", sql).empty());

    const std::string nul("a\0b", 3);
    const std::vector<std::pair<std::string, std::string>> refused = {
        {"projectName", sql},          {"projectName", "../lib"},     {"projectName", std::string(65, 'a')},
        {"projectName", ""},           {"path", "relative"},          {"path", "/a/../etc"},
        {"path", "/a/" + nul},         {"path", "/" + std::string(kMaxPath, 'a')},
        {"userName", "a/b"},           {"userName", nul},             {"userName", std::string(500, 'u')},
        {"password", std::string(kMaxPassword + 1, 'p')},
    };
    for (const auto& r : refused) {
        LinkSpec bad = link;
        (r.first == "projectName" ? bad.projectName : r.first == "path" ? bad.path
                                                      : r.first == "userName" ? bad.userName : bad.password) = r.second;
        EXPECT_FALSE(entries_.Create(bad, got)) << r.first << " " << r.second.substr(0, 40);
    }
    record::Session s;
    record::Token t;
    for (const std::string& id : {sql, nul, std::string(100000, 'A'), e.get_hash() + "' OR '1'='1"}) {
        EXPECT_FALSE(entries_.GetByHash(id, got));
        EXPECT_FALSE(sessions_.GetBySessionId(id, s));
        EXPECT_EQ(SHARING_STATUS_NO_LINK, CheckSharing(id, id, id));
        EXPECT_EQ(SHARING_STATUS_NO_LINK, sessions_.Create(id, "", "10.0.0.1", 0, s, t));
    }
    EXPECT_EQ(SHARING_STATUS_ERROR, sessions_.Create(e.get_hash(), sql, sql, 0, s, t));
    std::vector<record::Entry> all;
    ASSERT_TRUE(entries_.ListAll(all));
    EXPECT_EQ(1u, all.size());
}

TEST_F(Sharing, ProcessesAtOnceLoseNothing)
{
    const record::Entry shared = Link(0, false, 10);
    // Each child first tries for ten uses of the shared link (its exit code
    // is how many it got), then makes five links with a session each.
    const std::vector<int> got = InChildren(4, [&](int i) {
        EntryDB entries(SharingDB::Instance());
        SessionDB sessions(SharingDB::Instance());
        record::Session s;
        record::Token t;
        int uses = 0;
        for (int n = 0; n < 10; ++n) {
            uses += sessions.Create(shared.get_hash(), "", "10.0.0.1", 0, s, t) == SHARING_STATUS_VALID ? 1 : 0;
        }
        for (int n = 0; n < 5; ++n) {
            LinkSpec link;
            link.projectName = "photo";
            link.path = "/volume1/" + std::to_string(i) + "/" + std::to_string(n);
            link.uid = 2000 + i;
            link.userName = "child";
            record::Entry e;
            if (!entries.Create(link, e) || sessions.Create(e.get_hash(), "", "10.0.0.1", 0, s, t) != 1) {
                return 100;
            }
        }
        return uses;
    });
    int total = 0;
    for (int code : got) {
        ASSERT_LE(code, 10);
        total += code;
    }
    EXPECT_EQ(10, total);
    record::Entry after;
    ASSERT_TRUE(entries_.GetByHash(shared.get_hash(), after));
    EXPECT_EQ(10, after.get_use_count());
    std::vector<record::Entry> all;
    ASSERT_TRUE(entries_.ListAll(all));
    EXPECT_EQ(21u, all.size());
    for (int i = 0; i < 4; ++i) {
        ASSERT_TRUE(entries_.ListByOwner(2000 + i, all));
        EXPECT_EQ(5u, all.size());
        for (const record::Entry& e : all) {
            EXPECT_EQ(1, e.get_use_count());
        }
    }
}

TEST(SharingURL, Cases)
{
    struct Case {
        const char* host;
        int port;
        bool https;
        const char* app;
        const char* url;
        _tag_SHARING_URL_TYPE type;
    } cases[] = {
        {"nas.example.com", 0, false, "", "http://nas.example.com/sharing/", SHARING_URL_TYPE_DIRECT},
        {"nas.example.com", 443, true, "photo", "https://nas.example.com/sharing/photo/", SHARING_URL_TYPE_DIRECT},
        {"nas", 5001, true, "", "https://nas:5001/sharing/", SHARING_URL_TYPE_PORT},
        {"10.0.0.5", 80, false, "", "http://10.0.0.5/sharing/", SHARING_URL_TYPE_DIRECT},
        {"10.0.0.5", 443, false, "", "http://10.0.0.5:443/sharing/", SHARING_URL_TYPE_PORT},
        {"fe80::1", 8080, false, "", "http://[fe80::1]:8080/sharing/", SHARING_URL_TYPE_PORT},
        {"[::1]", 0, true, "", "https://[::1]/sharing/", SHARING_URL_TYPE_DIRECT},
        {"", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"evil.com/x", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"evil.com@x", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"a..b", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"-a.b", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"[fe80::1%eth0]", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"[nas]", 80, false, "", "", SHARING_URL_TYPE_NONE},
        {"nas", 65536, false, "", "", SHARING_URL_TYPE_NONE},
        {"nas", -1, false, "", "", SHARING_URL_TYPE_NONE},
        {"nas", 80, false, "../x", "", SHARING_URL_TYPE_NONE},
        {"nas", 80, false, "a/b", "", SHARING_URL_TYPE_NONE},
    };
    for (const Case& c : cases) {
        std::string url = "stale";
        _tag_SHARING_URL_TYPE type = SHARING_URL_TYPE_PORT;
        EXPECT_EQ(c.type != SHARING_URL_TYPE_NONE, GetSharingURL(c.host, c.port, c.https, c.app, url, type)) << c.host;
        EXPECT_EQ(c.url, url) << c.host;
        EXPECT_EQ(c.type, type) << c.host;
    }
    std::string url;
    _tag_SHARING_URL_TYPE type;
    EXPECT_FALSE(GetSharingURL(std::string(254, 'a'), 80, false, "", url, type));
}

TEST_F(Sharing, LibsqliteOnlyWhenUsedAndFailsClosedWithout)
{
    Ran ran = RunTool({"/proc/self/exe"}, {{"VELA_SHARING_PROBE", "1"}});
    EXPECT_EQ("plain=0\nstatus=2 good=1\ncreated=1 sqlite=1\n", ran.out) << ran.err;
    TempDir libs;
    WriteFile(libs.Path() + "/libsqlite3.so.0", "not a library");
    ran = RunTool({"/proc/self/exe"}, {{"VELA_SHARING_PROBE", "1"}, {"LD_LIBRARY_PATH", libs.Path()}});
    EXPECT_EQ("plain=0\nstatus=0 good=0\ncreated=0 sqlite=0\n", ran.out) << ran.err;
}

}  // namespace
