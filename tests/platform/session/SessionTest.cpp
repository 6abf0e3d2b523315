// Login sessions against real files under a temporary VELA_ROOT: every
// verdict of VelaCgiIsAuthorizedEx, hostile ids, corrupt files, clock steps,
// concurrent processes, and the calls that read the same session.

#include <cstring>
#include <pwd.h>

#include "platform/PlatformTest.h"
#include "vela/webapiutil.h"

namespace {

using namespace VELA::Test;
using VELA::Session::Options;

const char kClient[] = "192.0.2.7";
const char kAbsent[] = "AAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAA";

// The default options with `field` set to `value`.
template <typename T, typename V>
Options With(T Options::*field, V value)
{
    Options options;
    options.*field = value;
    return options;
}

Options Timed(int idleTimeout, int lifetime = 0)
{
    Options options = With(&Options::idleTimeout, idleTimeout);
    options.lifetime = lifetime;
    return options;
}

class SessionTest : public StateRootTest {
protected:
    std::string Dir() const { return In("/run/vela/sessions"); }
    std::string File(const std::string& sid) const { return Dir() + "/" + sid; }

    std::string Create(const Options& options = Options(), const char* user = "root", const char* ip = kClient,
                       std::string* token = nullptr)
    {
        std::string sid, tok;
        EXPECT_EQ(0, VELA::Session::Create(user, ip, &options, sid, tok));
        EXPECT_EQ(32u, sid.size());
        EXPECT_EQ(32u, tok.size());
        if (token != nullptr) {
            *token = tok;
        }
        return sid;
    }

    int Check(const std::string& sid, int flags = 0, VELACGI_CTX* ctx = nullptr)
    {
        char user[493];
        return VelaCgiIsAuthorizedEx(ctx, sid.c_str(), user, sizeof(user), nullptr, flags);
    }

    Json::Value Read(const std::string& sid)
    {
        Json::Value doc;
        EXPECT_TRUE(VELA::WebAPIUtil::ReadJsonFile(File(sid), doc)) << sid;
        return doc;
    }

    void Edit(const std::string& sid, const char* key, const Json::Value& value) { EditJson(File(sid), key, value); }

    // Checks `sid` once per step, after the clock moved by the step's seconds.
    struct Step { long long advance; int verdict; int flags = 0; };
    void Steps(const std::string& sid, std::initializer_list<Step> steps)
    {
        int i = 0;
        for (const Step& step : steps) {
            Now() += step.advance;
            EXPECT_EQ(step.verdict, Check(sid, step.flags)) << "step " << i++ << " at " << Now() - kStart;
        }
    }

    ScopedEnv remote_{"REMOTE_ADDR", kClient};
    ScopedEnv forwarded_{"HTTP_X_FORWARDED_FOR", nullptr};
    ScopedEnv header_{"HTTP_X_VELA_TOKEN", nullptr};
    ScopedEnv query_{"QUERY_STRING", nullptr};
    ScopedEnv lang_{"HTTP_ACCEPT_LANGUAGE", nullptr};
    ScopedEnv cookie_{"HTTP_COOKIE", nullptr};
    LogCapture log_;
};

TEST_F(SessionTest, CreateRefusesBadInput)
{
    std::string sid = "stale", token = "stale";
    EXPECT_EQ(-1, VELA::Session::Create("vela-no-such-user", kClient, nullptr, sid, token));
    EXPECT_TRUE(sid.empty() && token.empty());
    EXPECT_TRUE(log_.Contains("no user \"vela-no-such-user\""));
    const std::pair<const char*, const char*> bad[] = {
        {nullptr, kClient}, {"", kClient}, {"../root", kClient}, {"root", "999.1.1.1"}, {"root", "192.0.2.7\n"}};
    for (const auto& [user, ip] : bad) {
        EXPECT_EQ(-1, VELA::Session::Create(user, ip, nullptr, sid, token)) << (user ? user : "null") << " " << ip;
    }
    for (const Options& options : {With(&Options::lang, "EN"), Timed(VELA_SESSION_IDLE_MAX + 1), Timed(0, -5),
                                   With(&Options::app, "a\nb")}) {
        EXPECT_EQ(-1, VELA::Session::Create("root", kClient, &options, sid, token));
    }
    std::vector<VELA::Session::Record> list;
    ASSERT_EQ(0, VELA::Session::List(list));
    EXPECT_TRUE(list.empty());
}

TEST_F(SessionTest, CreateAndCheckValidSession)
{
    Options options = Timed(600);
    options.app = "VELA.Demo";
    options.webapi = "demo";
    options.lang = "ger";
    const std::string sid = Create(options);
    for (char c : sid) {
        EXPECT_TRUE(isalnum(static_cast<unsigned char>(c)) || c == '-' || c == '_') << sid;
    }
    EXPECT_EQ(0700u, Mode(Dir()));
    EXPECT_EQ(0600u, Mode(File(sid)));

    const Json::Value doc = Read(sid);
    ExpectMembers(doc, {{"user", "root"}, {"id", sid}, {"created", Json::Int64(kStart)},
                        {"lastUse", Json::Int64(kStart)}, {"idleTimeout", 600},
                        {"lifetime", VELA_SESSION_LIFETIME_DEFAULT}, {"clientIP", kClient}, {"skipIP", false},
                        {"lang", "ger"}});
    EXPECT_EQ(32u, doc["token"].asString().size());

    EXPECT_NE(sid, Create());

    CgiHandle h;
    EXPECT_STREQ("fallback", VelaCgiGetOption(h.ctx, VELACGI_OPT_TIMEOUT, "fallback"));
    EXPECT_EQ(nullptr, VelaCgiGetOption(h.ctx, VELACGI_OPT_SKIP_IP, nullptr));
    EXPECT_STREQ("", VelaCgiGetSessionFile(h.ctx));

    char user[493];
    VELACGI_SESSION_INFO info;
    ASSERT_EQ(AUTH_RESULT_AUTHORIZED, VelaCgiIsAuthorizedEx(h.ctx, sid.c_str(), user, sizeof(user), &info, 0));
    EXPECT_STREQ("root", user);
    EXPECT_EQ(File(sid), VelaCgiGetSessionFile(h.ctx));
    EXPECT_EQ(600, VelaCgiGetTimeout(h.ctx));
    EXPECT_EQ(0, VelaCgiGetSkipCheckIP(h.ctx));
    EXPECT_STREQ("600", VelaCgiGetOption(h.ctx, VELACGI_OPT_TIMEOUT, "0"));
    EXPECT_STREQ("0", VelaCgiGetOption(h.ctx, VELACGI_OPT_SKIP_IP, nullptr));
    EXPECT_STREQ("VELA.Demo", VelaCgiGetOption(h.ctx, VELACGI_OPT_APP, ""));
    EXPECT_STREQ("demo", VelaCgiGetOption(h.ctx, VELACGI_OPT_WEBAPI, ""));
    EXPECT_STREQ("x", VelaCgiGetOption(h.ctx, 99, "x"));
    char lang[4];
    ASSERT_EQ(0, VelaCgiGetLang(h.ctx, lang, sizeof(lang)));
    EXPECT_STREQ("ger", lang);
    EXPECT_EQ(kStart, info.created);
    EXPECT_EQ(600, info.idleTimeout);
    EXPECT_STREQ(kClient, info.clientIP);
    EXPECT_STREQ("ger", info.lang);

    // A refusal on the same handle clears what the valid check filled.
    ASSERT_EQ(AUTH_RESULT_NO_SESSION, VelaCgiIsAuthorizedEx(h.ctx, kAbsent, user, sizeof(user), &info, 0));
    EXPECT_STREQ("", user);
    EXPECT_STREQ("", VelaCgiGetSessionFile(h.ctx));
    EXPECT_EQ(0, VelaCgiGetTimeout(h.ctx));
    EXPECT_STREQ("0", VelaCgiGetOption(h.ctx, VELACGI_OPT_TIMEOUT, "0"));
    EXPECT_EQ(0, info.created);

    // The user name must fit the caller's buffer.
    char small[4];
    EXPECT_EQ(AUTH_RESULT_REJECTED, VelaCgiIsAuthorizedEx(h.ctx, sid.c_str(), small, sizeof(small), nullptr, 0));
    EXPECT_STREQ("", small);
}

TEST_F(SessionTest, IdleTimeoutAndLifetime)
{
    const std::string sid = Create(Timed(100, 250));
    Steps(sid, {{100, AUTH_RESULT_AUTHORIZED}});  // exactly the idle timeout: still valid, and refreshed
    EXPECT_EQ(Now(), Read(sid)["lastUse"].asInt64());
    Steps(sid, {{100, AUTH_RESULT_AUTHORIZED}, {51, AUTH_RESULT_TIMEOUT}});  // 251 s on: past the lifetime

    const std::string idle = Create(Timed(100, 250));
    Steps(idle, {{101, AUTH_RESULT_TIMEOUT}});
    EXPECT_EQ(Now() - 101, Read(idle)["lastUse"].asInt64());  // a timed-out check refreshes nothing
    Steps(idle, {{0, AUTH_RESULT_TIMEOUT}});

    for (const char* key : {"lastUse", "created"}) {  // far in the past
        const std::string old = Create();
        Edit(old, key, Json::Int64(0));
        EXPECT_EQ(AUTH_RESULT_TIMEOUT, Check(old)) << key;
    }

    // A check without refresh lets the session time out.
    const long long created = Now();
    const std::string polled = Create(Timed(100));
    const std::string used = Create(Timed(100));
    for (int i = 0; i < 3; ++i) {
        Now() += 60;
        EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(used)) << i;
        EXPECT_EQ(i == 0 ? AUTH_RESULT_AUTHORIZED : AUTH_RESULT_TIMEOUT, Check(polled, VELACGI_AUTH_NO_REFRESH)) << i;
    }
    EXPECT_EQ(created, Read(polled)["lastUse"].asInt64());
    EXPECT_EQ(Now(), Read(used)["lastUse"].asInt64());
}

// A check moves the last use only once it is a step old; the idle timeout
// counts from the last use written, so a session may time out up to a step
// early.
TEST_F(SessionTest, LastUseMovesInSteps)
{
    const int step = VELA_SESSION_LAST_USE_STEP;
    const std::string sid = Create(Timed(100));
    Steps(sid, {{step - 1, AUTH_RESULT_AUTHORIZED}});
    EXPECT_EQ(kStart, Read(sid)["lastUse"].asInt64());
    Steps(sid, {{1, AUTH_RESULT_AUTHORIZED}});
    const long long written = Now();
    EXPECT_EQ(written, Read(sid)["lastUse"].asInt64());
    Steps(sid, {{step - 1, AUTH_RESULT_AUTHORIZED}});  // used, not written
    EXPECT_EQ(written, Read(sid)["lastUse"].asInt64());
    Steps(sid, {{100 - (step - 1) + 1, AUTH_RESULT_TIMEOUT}});  // idle for 101 s by the file, less in truth
    EXPECT_EQ(written, Read(sid)["lastUse"].asInt64());

    // A check without refresh never moves it, a step or not.
    const std::string polled = Create(Timed(100));
    Steps(polled, {{step, AUTH_RESULT_AUTHORIZED, VELACGI_AUTH_NO_REFRESH}});
    EXPECT_EQ(Now() - step, Read(polled)["lastUse"].asInt64());
}

// The clock went back: a last use in the future counts as now, with a
// refresh or without, and a creation in the future starts the lifetime now.
TEST_F(SessionTest, TimesInTheFutureCountAsNow)
{
    for (int flags : {0, VELACGI_AUTH_NO_REFRESH}) {
        const std::string sid = Create(Timed(100));
        Edit(sid, "lastUse", Json::Int64(Now() + 1000000));
        Steps(sid, {{0, AUTH_RESULT_AUTHORIZED, flags}});
        EXPECT_EQ(Now(), Read(sid)["lastUse"].asInt64());
        Steps(sid, {{101, AUTH_RESULT_TIMEOUT, flags}});
    }
    const std::string sid = Create(Timed(100, 200));
    Edit(sid, "created", Json::Int64(Now() + 1000000));
    Steps(sid, {{0, AUTH_RESULT_AUTHORIZED}});
    EXPECT_EQ(Now(), Read(sid)["created"].asInt64());
    Steps(sid, {{90, AUTH_RESULT_AUTHORIZED}, {90, AUTH_RESULT_AUTHORIZED}, {90, AUTH_RESULT_TIMEOUT}});
}

TEST_F(SessionTest, UnknownAndHostileIdsTouchNothing)
{
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(kAbsent));  // no directory yet
    const std::string sid = Create();
    // Files a path traversal could reach, inside and outside the state tree.
    std::ofstream(root_.Path() + "/x") << "outside";
    std::ofstream(root_.Path() + "/run/vela/x") << "outside";
    const auto before = Tree(root_.Path());

    char nul[33];
    memcpy(nul, sid.c_str(), 33);
    nul[10] = '\0';
    std::string binary(32, '\xff');
    std::string slashes = "../../../../../../../../../../../x";
    slashes.resize(32, 'a');
    const std::vector<std::string> hostile = {
        kAbsent, "", ".", "..", "../x", "../../x", "/etc/passwd", ".lock", std::string(10000, 'A'), sid + "A",
        sid.substr(0, 31), binary, slashes, sid.substr(0, 31) + "/", sid.substr(0, 31) + ".",
        std::string(31, 'A') + "=", "A%2e%2eAAAAAAAAAAAAAAAAAAAAAAAAAA", std::string(32, ' '),
    };
    for (const std::string& id : hostile) {
        EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(id)) << id;
        EXPECT_EQ(-2, VELA::Session::Remove(id.c_str())) << id;
        EXPECT_EQ(-1, VelaCgiUIDGet(id.c_str(), "root")) << id;
    }
    char user[493];
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, VelaCgiIsAuthorizedEx(nullptr, nul, user, sizeof(user), nullptr, 0));
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, VelaCgiIsAuthorizedEx(nullptr, nullptr, user, sizeof(user), nullptr, 0));
    EXPECT_EQ(-2, VELA::Session::Remove(nullptr));
    EXPECT_TRUE(log_.Contains("malformed session id"));

    EXPECT_EQ(before, Tree(root_.Path()));
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(sid, VELACGI_AUTH_NO_REFRESH));
}

TEST_F(SessionTest, CorruptFilesAreNoSessionAndStayAsTheyAre)
{
    const std::string sid = Create();
    const std::string good = ReadText(File(sid));
    ASSERT_GT(good.size(), 100u);
    const Json::Value doc = Read(sid);

    std::vector<std::string> bad;
    for (size_t len = 0; len < good.size() - 1; len += 5) {
        bad.push_back(good.substr(0, len));  // truncated
    }
    bad.insert(bad.end(), {"garbage", "[]", "null", good + "trailing",
                           std::string(20000, ' ') + good});  // the last larger than a session file may be
    const std::vector<std::pair<std::string, Json::Value>> changes = {
        {"version", 2}, {"id", "BBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBB"}, {"user", 5}, {"user", ""},
        {"user", std::string("ro\0ot", 5)}, {"created", "1700000000"}, {"created", -1}, {"lastUse", 1.5},
        {"idleTimeout", 0}, {"idleTimeout", Json::Int64(VELA_SESSION_IDLE_MAX) + 1}, {"lifetime", -3},
        {"clientIP", "not an address"}, {"skipIP", 1}, {"lang", "english"}, {"tokenProtect", "true"},
        {"token", "short"}, {"app", std::string(300, 'a')}};
    for (const std::string& text : JsonVariants(doc, changes, {"version", "id", "user", "created", "lastUse",
                                                               "idleTimeout", "lifetime", "clientIP", "skipIP", "app",
                                                               "webapi", "lang", "tokenProtect", "token"})) {
        bad.push_back(text);
    }

    for (const std::string& text : bad) {
        WriteFile(File(sid), text, 0600);
        EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(sid)) << text;
        EXPECT_EQ(-1, VelaCgiUIDGet(sid.c_str(), "root")) << text;
        EXPECT_EQ(text, ReadText(File(sid))) << "the file was rewritten";
    }

    // A valid session file under another session's name is no session.
    const std::string other = Create();
    ASSERT_EQ(0, rename(File(other).c_str(), File(sid).c_str()));
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(sid));

    // Only regular files of ours are read: no link, no FIFO (and no wait for
    // its writer), no file of another user.
    const std::string target = Create(), link = Create(), fifo = Create(), foreign = Create();
    ASSERT_FALSE(unlink(File(link).c_str()) || symlink(File(target).c_str(), File(link).c_str()));
    ASSERT_FALSE(unlink(File(fifo).c_str()) || mkfifo(File(fifo).c_str(), 0600));
    ASSERT_EQ(0, geteuid() == 0 ? chown(File(foreign).c_str(), 65534, 65534) : unlink(File(foreign).c_str()));
    for (const std::string& id : {link, fifo, foreign}) {
        EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(id)) << id;
    }
}

TEST_F(SessionTest, ClientAddressMustMatch)
{
    const std::string sid = Create();
    {
        ScopedEnv other("REMOTE_ADDR", "198.51.100.1");
        EXPECT_EQ(AUTH_RESULT_IP_MISMATCH, Check(sid));
        EXPECT_TRUE(log_.Contains("request from 198.51.100.1"));
        EXPECT_EQ(kStart, Read(sid)["lastUse"].asInt64());
        Now() += 10;
        EXPECT_EQ(AUTH_RESULT_IP_MISMATCH, Check(sid));
        EXPECT_EQ(kStart, Read(sid)["lastUse"].asInt64());  // a refused check keeps nothing alive

        // The method may exempt itself from the address check.
        CgiHandle h;
        ASSERT_EQ(0, VelaCgiSetSkipCheckIP(h.ctx, 1));
        EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(sid, 0, h.ctx));
        EXPECT_STREQ("0", VelaCgiGetOption(h.ctx, VELACGI_OPT_SKIP_IP, nullptr));  // the session's own flag
    }
    for (const auto& peer : {std::make_pair(static_cast<const char*>(nullptr), AUTH_RESULT_IP_MISMATCH),
                             std::make_pair("::ffff:192.0.2.7", AUTH_RESULT_AUTHORIZED)}) {
        ScopedEnv remote("REMOTE_ADDR", peer.first);
        EXPECT_EQ(peer.second, Check(sid)) << (peer.first ? peer.first : "no address");
    }

    const std::string roaming = Create(With(&Options::skipIP, true));
    const std::string unbound = Create(Options(), "root", "");
    ScopedEnv other("REMOTE_ADDR", "2001:db8::1");
    CgiHandle h;
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(roaming, 0, h.ctx));
    EXPECT_EQ(1, VelaCgiGetSkipCheckIP(h.ctx));
    EXPECT_STREQ("1", VelaCgiGetOption(h.ctx, VELACGI_OPT_SKIP_IP, nullptr));
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(unbound));
    EXPECT_TRUE(Read(unbound)["skipIP"].asBool());
    EXPECT_EQ(AUTH_RESULT_IP_MISMATCH, Check(sid));
}

TEST_F(SessionTest, AntiForgeryToken)
{
    const Options options = With(&Options::tokenProtect, true);
    std::string token, otherToken;
    const std::string sid = Create(options, "root", kClient, &token);
    const std::string other = Create(options, "root", kClient, &otherToken);

    EXPECT_EQ(AUTH_RESULT_TOKEN_MISSING, Check(sid));
    EXPECT_TRUE(log_.Contains("anti-forgery token missing or wrong"));
    {
        ScopedEnv wrong("HTTP_X_VELA_TOKEN", otherToken.c_str());
        Now() += 5;
        EXPECT_EQ(AUTH_RESULT_TOKEN_MISSING, Check(sid));
        EXPECT_EQ(kStart, Read(sid)["lastUse"].asInt64());
    }
    std::string encoded;
    for (char c : token) {
        char hex[4];
        snprintf(hex, sizeof(hex), "%%%02X", static_cast<unsigned char>(c));
        encoded += hex;
    }
    const struct { std::string header, query; int verdict; } cases[] = {  // "": not sent
        {token.substr(0, 31), "", AUTH_RESULT_TOKEN_MISSING}, {token + "x", "", AUTH_RESULT_TOKEN_MISSING},
        {token, "", AUTH_RESULT_AUTHORIZED},
        {"", "api=VELA.Demo&VelaToken=" + token + "&method=get", AUTH_RESULT_AUTHORIZED},
        {"", "Vela%54oken=" + encoded, AUTH_RESULT_AUTHORIZED},
        {"", "XVelaToken=" + token + "&VelaTokenX=" + token, AUTH_RESULT_TOKEN_MISSING},
    };
    for (const auto& c : cases) {
        ScopedEnv header("HTTP_X_VELA_TOKEN", c.header.empty() ? nullptr : c.header.c_str());
        ScopedEnv query("QUERY_STRING", c.query.empty() ? nullptr : c.query.c_str());
        EXPECT_EQ(c.verdict, Check(sid)) << c.header << c.query;
        if (c.header == token) {
            EXPECT_EQ(AUTH_RESULT_TOKEN_MISSING, Check(other));
        }
    }

    // Token protection is a property of the session.
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(Create()));
    CgiHandle h;
    for (const auto& cookie : {std::make_pair("id=" + sid, 1), std::make_pair("id=" + Create(), 0),
                               std::make_pair(std::string("id=../x"), 0)}) {
        ScopedEnv env("HTTP_COOKIE", cookie.first.c_str());
        ASSERT_EQ(0, VelaCgiLoadInCookies(h.ctx));
        EXPECT_EQ(cookie.second, VelaCgiIsTokenEnable(h.ctx)) << cookie.first;
    }
    EXPECT_EQ(0, VelaCgiIsTokenEnable(nullptr));
}

TEST_F(SessionTest, UserOfTheSession)
{
    const std::string sid = Create();
    EXPECT_EQ(0, VelaCgiUIDGet(sid.c_str(), "root"));
    EXPECT_EQ(-1, VelaCgiUIDGet(sid.c_str(), "nobody"));  // the user must be the session's
    EXPECT_TRUE(VelaCgiUIDGet(sid.c_str(), nullptr) == -1 && VelaCgiUIDGet(nullptr, "root") == -1);

    struct passwd* nobody = getpwnam("nobody");
    ASSERT_NE(nullptr, nobody);
    const std::string nsid = Create(Options(), "nobody");
    EXPECT_EQ(static_cast<int>(nobody->pw_uid), VelaCgiUIDGet(nsid.c_str(), "nobody"));

    // A session whose user has gone away is no session.
    Edit(nsid, "user", "vela-no-such-user");
    EXPECT_EQ(-1, VelaCgiUIDGet(nsid.c_str(), "vela-no-such-user"));
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(nsid));
    EXPECT_TRUE(log_.Contains("no longer exists"));
}

TEST_F(SessionTest, ListRemovePurge)
{
    const std::string a = Create(Timed(60));
    Now() += 1;
    const std::string b = Create(Options(), "nobody", "2001:db8::1");
    Now() += 1;
    const std::string c = Create(Timed(7200));
    std::ofstream(Dir() + "/not-a-session") << "x";

    std::vector<VELA::Session::Record> list;
    ASSERT_EQ(0, VELA::Session::List(list));
    ASSERT_EQ(3u, list.size());
    EXPECT_EQ((std::vector<std::string>{a, b, c}), (std::vector<std::string>{list[0].sid, list[1].sid, list[2].sid}));
    EXPECT_EQ("nobody", list[1].user);
    EXPECT_EQ("2001:db8::1", list[1].clientIP);
    EXPECT_FALSE(list[0].expired);

    EXPECT_EQ(0, VELA::Session::Remove(b.c_str()));
    EXPECT_EQ(-2, VELA::Session::Remove(b.c_str()));
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(b));

    Now() += 61;
    ASSERT_EQ(0, VELA::Session::List(list));
    ASSERT_EQ(2u, list.size());
    EXPECT_TRUE(list[0].expired);
    EXPECT_FALSE(list[1].expired);
    EXPECT_EQ(0, VELA::Session::Purge(3600));  // within the grace period
    EXPECT_EQ(AUTH_RESULT_TIMEOUT, Check(a));
    Now() += 3600;
    EXPECT_EQ(1, VELA::Session::Purge(3600));
    EXPECT_EQ(AUTH_RESULT_NO_SESSION, Check(a));
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(c));
    EXPECT_EQ(-1, VELA::Session::Purge(-1));
}

TEST_F(SessionTest, LanguageFromSessionOrHeader)
{
    CgiHandle h;
    char buf[4];
    auto lang = [&](const char* header) {
        ScopedEnv env("HTTP_ACCEPT_LANGUAGE", header);
        EXPECT_EQ(0, VelaCgiGetLang(h.ctx, buf, sizeof(buf)));
        return std::string(buf);
    };
    EXPECT_EQ("enu", lang(nullptr));
    const std::pair<std::string, const char*> headers[] = {
        {"", "enu"}, {"de-DE,de;q=0.9,en;q=0.8", "ger"}, {"fr;q=0.5, ja;q=0.9", "jpn"},
        {"fr;q=0.5, ja;q=0.5", "fra"},  // a tie goes to the first
        {"zh-TW", "cht"}, {"zh-Hant-HK", "cht"}, {"zh-CN", "chs"}, {"zh", "chs"}, {"pt-BR", "ptb"}, {"pt-PT", "ptg"},
        {"en-GB", "enu"}, {"xx-YY, *;q=0.9, de;q=0.1", "ger"}, {"en;q=0, de", "ger"}, {"de;q=1.5", "enu"},
        {"de;level=1", "enu"}, {";;;,,,=q;", "enu"}, {"de," + std::string(5000, 'a'), "enu"},
    };
    for (const auto& header : headers) {
        EXPECT_EQ(header.second, lang(header.first.c_str())) << header.first.substr(0, 40);
    }

    ASSERT_EQ(AUTH_RESULT_AUTHORIZED, Check(Create(With(&Options::lang, "fra")), 0, h.ctx));
    EXPECT_EQ("fra", lang("de"));
    ASSERT_EQ(AUTH_RESULT_AUTHORIZED, Check(Create(), 0, h.ctx));  // no language in the session
    EXPECT_EQ("ger", lang("de"));

    char small[3] = "xx";
    EXPECT_EQ(-1, VelaCgiGetLang(h.ctx, small, sizeof(small)));
    EXPECT_STREQ("", small);
    EXPECT_EQ(-1, VelaCgiGetLang(h.ctx, nullptr, 4));
    EXPECT_EQ(0, VelaCgiGetLang(nullptr, buf, sizeof(buf)));
}

// Many processes refresh one session at once: every check must pass and the
// file must stay a valid session.
TEST_F(SessionTest, ConcurrentProcessesShareOneSession)
{
    // Idle for a day at most: the processes' clocks drift apart by far more
    // than the default idle timeout.
    const std::string sid = Create(Timed(86400));
    const int kChecks = 50;
    const long long step = VELA_SESSION_LAST_USE_STEP;
    const std::vector<int> failures = InChildren(8, [&](int) {
        int failed = 0;
        for (int i = 0; i < kChecks; ++i) {
            Now() = kStart + i * step;  // every check has a new time to write
            char user[493];
            const int verdict = VelaCgiIsAuthorizedEx(nullptr, sid.c_str(), user, sizeof(user), nullptr, 0);
            failed += verdict != AUTH_RESULT_AUTHORIZED || strcmp(user, "root") != 0 ? 1 : 0;
        }
        return failed;
    });
    EXPECT_EQ(std::vector<int>(8, 0), failures) << "failed checks per process";
    const Json::Value doc = Read(sid);
    EXPECT_EQ(sid, doc["id"].asString());
    EXPECT_GE(doc["lastUse"].asInt64(), kStart);
    EXPECT_LT(doc["lastUse"].asInt64(), kStart + kChecks * step);
    Now() = kStart + kChecks * step;
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, Check(sid));

    // No temporary file is left behind.
    for (const std::string& name : DirEntries(Dir())) {
        EXPECT_TRUE(name == sid || name == ".lock") << name;
    }
}

// A session removed while other processes refresh it stays removed: no
// process may write it back, and no check after the removal passes.
TEST_F(SessionTest, RemovalWinsOverConcurrentRefresh)
{
    for (int round = 0; round < 5; ++round) {
        const std::string sid = Create(Timed(86400));  // see ConcurrentProcessesShareOneSession
        Children children(4, [&](int) {
            bool removed = false;
            for (int i = 1; i <= 200; ++i) {
                Now() = kStart + i * VELA_SESSION_LAST_USE_STEP;  // every check has a new time to write
                const int verdict = Check(sid);
                if (verdict == AUTH_RESULT_NO_SESSION) {
                    removed = true;
                } else if (verdict != AUTH_RESULT_AUTHORIZED || removed) {
                    return 1;
                }
            }
            return 0;
        });
        // Remove once the children are refreshing (bounded wait, not a timing
        // assertion: removing earlier only makes the round less interesting).
        WaitUntil([&] { return Read(sid)["lastUse"].asInt64() != kStart; }, 2000, 1000);
        EXPECT_EQ(0, VELA::Session::Remove(sid.c_str()));
        EXPECT_EQ(std::vector<int>(4, 0), children.Wait()) << "a check passed after the removal";
        struct stat st;
        EXPECT_NE(0, lstat(File(sid).c_str(), &st)) << "the session came back";
    }
}

}  // namespace
