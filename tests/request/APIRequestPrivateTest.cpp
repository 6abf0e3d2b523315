// What APIRequest derives from the environment and the cookies: session
// facts, the client kind from the user agent, URL and protocol.
#include <gtest/gtest.h>
#include <string>
#include <sys/stat.h>

#include "platform/StateRootTest.h"
#include "support/JsonLiteral.h"
#include "support/LinearTime.h"
#include "support/SessionFacts.h"
#include "support/TestSupport.h"
#include "vela/vlibc.h"
#include "webapi/APIRequest.h"

using VELA::APIRequest;

namespace {

APIRequest WithCookie(const std::string& header)
{
    Json::Value request(Json::objectValue);
    request["environ"]["HTTP_COOKIE"] = header;
    return APIRequest(request);
}

}  // namespace

TEST(RequestCookieHeader, PiecesNamesAndValues)
{
    APIRequest r = WithCookie("id=abc; lang=en%20US;broken;k=a=b;  sp=1;=novalue;e=");
    EXPECT_EQ("abc", r.GetSessionID());
    EXPECT_EQ("en US", r.GetCookie("lang"));
    EXPECT_EQ("a=b", r.GetCookie("k"));
    EXPECT_EQ("1", r.GetCookie("sp"));  // blanks after ";" are not part of the name
    EXPECT_EQ("", r.GetCookie("e", "d"));
    EXPECT_FALSE(r.HasCookie("broken"));
    EXPECT_FALSE(r.HasCookie(""));

    APIRequest odd = WithCookie("a=%; b=%4; c=%zz; d=%41%42; e=x+y; f=%00z; ;;; ");
    EXPECT_EQ("%", odd.GetCookie("a"));
    EXPECT_EQ("%4", odd.GetCookie("b"));
    EXPECT_EQ("%zz", odd.GetCookie("c"));
    EXPECT_EQ("AB", odd.GetCookie("d"));
    EXPECT_EQ(std::string("\0z", 2), odd.GetCookie("f"));
    APIRequest big = WithCookie("id=" + std::string(1 << 20, 'v') + ";" + std::string(100000, ';'));
    EXPECT_EQ(size_t(1) << 20, big.GetSessionID().size());
}

TEST(RequestCookieHeader, LaterCookieWinsAndSetCookiesSurviveAMerge)
{
    APIRequest r = WithCookie("id=one; id=two");
    EXPECT_EQ("two", r.GetSessionID());
    r.SetCookie("local", "x");
    r.InitEnv(J(R"({"HTTP_COOKIE": "id=three"})"));
    EXPECT_EQ("three", r.GetSessionID());
    EXPECT_EQ("x", r.GetCookie("local"));
}

// Cookies reach the process in one environment variable, which the kernel
// caps at 128 KiB; the request JSON of velarun has no cap, so the cookie
// parser is held to the same rule as the body parsers.
TEST(RequestCookieHeader, ParsedInLinearTime)
{
    const VELA::Test::LinearParser cookies = [](const std::string& text) {
        Json::Value request;
        request["environ"]["HTTP_COOKIE"] = text;
        APIRequest req(request);
        req.GetCookie("id", "");
    };
    for (const char* piece : {";", "a=;", "id=%41"}) {
        VELA::Test::ExpectLinear("cookie header", cookies, piece, 2u << 20);
    }
}

TEST(RequestSessionFacts, DefaultsStoredFactsAndTheirConversions)
{
    APIRequest r;
    EXPECT_EQ("1100 enu 0 |||", VELA::Test::SessionFacts(r));
    EXPECT_TRUE(r.HasAppPriv(""));
    EXPECT_FALSE(r.HasAppPriv("x"));
    EXPECT_EQ(static_cast<uid_t>(-1), r.GetLoginUID());

    APIRequest s(J(R"({"session": {"username": "alice", "isAdmin": "yes", "isTimeout": 0,
        "isSkipCheckIP": [], "isAuthorized": 2, "timeout": "900", "uiLang": "ger", "app": "a",
        "webapi": "w", "sessFile": "/f", "appPriv": "VELA.App"}})"));
    // Non-empty text counts as true, 0 and an empty container as false.
    EXPECT_EQ("0011 ger 900 alice|a|w|/f", VELA::Test::SessionFacts(s));
    EXPECT_TRUE(s.HasAppPriv("VELA.App"));
    EXPECT_FALSE(s.HasAppPriv(""));
}

TEST(RequestLoginUID, StoredUidOrThePlatformsAnswer)
{
    APIRequest r(J(R"({"session": {"uid": 1000, "username": "alice"}})"));
    EXPECT_EQ(1000u, r.GetLoginUID());
    APIRequest neg(J(R"({"session": {"uid": -1}})"));
    EXPECT_EQ(static_cast<uid_t>(-1), neg.GetLoginUID());
    APIRequest bad(J(R"({"session": {"uid": "1000"}})"));
    EXPECT_EQ(static_cast<uid_t>(-1), bad.GetLoginUID());

    // Without one the platform is asked, and its answer is stored in the
    // session even when it fails: it is not asked again.
    APIRequest p(J(R"({"session": {"username": "nobody-such-user"}, "environ": {"HTTP_COOKIE": "id=abc"}})"));
    VELA::Test::LogCapture log;
    const uid_t first = p.GetLoginUID();
    EXPECT_EQ(static_cast<uid_t>(-1), first);
    const size_t linesAfterFirst = log.Lines().size();
    EXPECT_EQ(first, p.GetLoginUID());
    EXPECT_EQ(linesAfterFirst, log.Lines().size());
    p.InitSession(J(R"({"username": "nobody-such-user", "uid": 42})"));
    EXPECT_EQ(42u, p.GetLoginUID());
}

TEST(RequestAllowUser, BitsFromTheDescription)
{
    APIRequest r(J(R"({"reqLib": {"allowUser": ["admin.local", "normal.ldap", 5, "Admin.local"]}})"));
    EXPECT_EQ(0x21, r.GetAllowUser());
    // Cached in the session: a new description does not change it.
    r.InitAPIInfo(J(R"({"allowUser": ["admin.domain"]})"));
    EXPECT_EQ(0x21, r.GetAllowUser());
    // A zero mask is never a cached answer.
    APIRequest z(J(R"({"reqLib": {"allowUser": ["nobody"]}})"));
    EXPECT_EQ(0, z.GetAllowUser());
    z.InitAPIInfo(J(R"({"allowUser": ["normal.local", "normal.domain", "admin.ldap"]})"));
    EXPECT_EQ(0x1C, z.GetAllowUser());
    // No list: zero, and nothing stored.
    for (const char* desc : {"{}", R"({"allowUser": "admin.local"})", R"({"allowUser": []})"}) {
        SCOPED_TRACE(desc);
        APIRequest r(J(std::string(R"({"reqLib": )") + desc + "}"));
        EXPECT_EQ(0, r.GetAllowUser());
        EXPECT_EQ(0, r.GetAllowUser());
    }
}

TEST(RequestKind, UploadPollingTaskAndAccessToken)
{
    auto upload = [](const char* env) { return APIRequest(J(std::string(R"({"environ": )") + env + "}")).IsUploadRequest(); };
    EXPECT_TRUE(upload(R"({"CONTENT_TYPE": "multipart/form-data; boundary=x"})"));
    EXPECT_FALSE(upload(R"({"CONTENT_TYPE": "Multipart/Form-Data; boundary=x"})"));
    EXPECT_TRUE(upload(R"({"CONTENT_TYPE": "Multipart/Form-Data", "HTTP_X_TYPE_NAME": "sliceUpload"})"));
    EXPECT_FALSE(upload(R"({"CONTENT_TYPE": "application/json"})"));
    EXPECT_FALSE(upload("{}"));
    EXPECT_FALSE(upload(R"({"HTTP_X_TYPE_NAME": "SLICEUPLOADX"})"));

    // A polling task needs both an id and a user.
    EXPECT_FALSE(APIRequest(J(R"({"environ": {"task_id": "t"}})")).IsPollingTask());
    APIRequest r(J(R"({"environ": {"task_id": "t", "task_user": "u", "full_task_id": "@u/t"}})"));
    EXPECT_TRUE(r.IsPollingTask());
    EXPECT_EQ("@u/t", r.GetPollingTaskId());
    EXPECT_EQ("", APIRequest().GetPollingTaskId());

    // The access token comes from the process environment, not the request's.
    APIRequest t(J(R"({"environ": {"velaAccessToken": "fromRequest"}})"));
    {
        VELA::Test::ScopedEnv env("velaAccessToken", nullptr);
        EXPECT_EQ(nullptr, t.GetVelaAccessTokenID());
    }
    VELA::Test::ScopedEnv env("velaAccessToken", "tok");
    ASSERT_NE(nullptr, t.GetVelaAccessTokenID());
    EXPECT_STREQ("tok", t.GetVelaAccessTokenID());
}

TEST(RequestEncryptedParams, HalfPairsEmptyMembersAndFailedDecryption)
{
    APIRequest r(J(R"({"getParam": {"__nEkOtReHpIc": "tok", "a": 1}})"));
    EXPECT_TRUE(r.HasParam("__nEkOtReHpIc"));
    EXPECT_EQ(1, r.GetParam("a").asInt());

    // An empty member drops the pair and nothing else.
    APIRequest e(J(R"({"postParam": {"__nEkOtReHpIc": "tok", "__tXeTrEhPiC": "", "a": 1}})"));
    EXPECT_FALSE(e.HasParam("__nEkOtReHpIc"));
    EXPECT_FALSE(e.HasParam("__tXeTrEhPiC"));
    EXPECT_EQ(1, e.GetParam("a").asInt());

    // A failed decryption keeps the rest and never succeeds falsely.
    VELA::Test::LogCapture log;
    APIRequest f(J(R"({"getParam": {"__cIpHeRtExT": "AAAA", "api": "VELA.A",
                                    "webapi": {"__nEkOtReHpIc": "t", "__tXeTrEhPiC": "c", "b": 2}}})"));
    EXPECT_FALSE(f.HasParam("__cIpHeRtExT"));
    EXPECT_EQ("VELA.A", f.GetAPIClass());
    // Decryption failed before the nested object was reached: it is kept.
    EXPECT_TRUE(f.GetParam("webapi").isMember("__tXeTrEhPiC"));
}

// The facts read from files under the system root.
using RequestUnderRoot = RootTest;

TEST_F(RequestUnderRoot, PreferenceDirUnderTheRootOrTmp)
{
    APIRequest r(J(R"({"session": {"username": "alice"}})"));
    const std::string dir = r.GetPreferenceDir();
    EXPECT_EQ(0u, dir.find(In("/")));
    struct stat st;
    EXPECT_EQ(0, stat(dir.c_str(), &st));
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(0u, r.GetGroupPreferenceDir("staff").find(In("/")));
    EXPECT_EQ("/tmp", r.GetGroupPreferenceDir("../etc"));
    EXPECT_EQ("/tmp", r.GetGroupPreferenceDir(""));
    EXPECT_EQ("/tmp", APIRequest(J(R"({"session": {"username": "a/b"}})")).GetPreferenceDir());
    EXPECT_EQ("/tmp", APIRequest().GetPreferenceDir());
}

namespace {

// The ten flags in one string, so a case reads as one line:
// M=mobile D=device I=iPhone A=android E=ieMobile P=iPad B=playBook
// K=blackBerry6 W=webKit S=supportWebApp; "-" for false.
std::string Flags(const APIRequest& r)
{
    bool (APIRequest::*const is[])() const = {
        &APIRequest::IsMobile, &APIRequest::IsMobileDevice, &APIRequest::IsIPhone, &APIRequest::IsAndroid,
        &APIRequest::IsIEMobile, &APIRequest::IsIPad, &APIRequest::IsPlayBook, &APIRequest::IsBlackBerry6,
        &APIRequest::IsWebKit, &APIRequest::IsSupportWebApp};
    std::string s;
    for (size_t i = 0; i < 10; ++i) {
        s += (r.*is[i])() ? "MDIAEPBKWS"[i] : '-';
    }
    return s;
}

// The flags of a request with the user agent `ua` (none when null) and the
// further environment `env` (JSON text).
std::string FlagsFor(const Json::Value& ua, const std::string& env = "{}")
{
    Json::Value request(Json::objectValue);
    request["environ"] = J(env);
    if (!ua.isNull()) {
        request["environ"]["HTTP_USER_AGENT"] = ua;
    }
    return Flags(APIRequest(request));
}

}  // namespace

// Device families by the user agent; gateway headers make a desktop agent
// mobile, but not a request without one; the cookie "forceDesktop" (a
// number other than 0) keeps the device but not "mobile".
TEST(RequestClient, DeviceFamiliesGatewaysAndForceDesktop)
{
    const char* iphone = "Mozilla/5.0 (iPhone) AppleWebKit/605";
    const struct {
        const char* ua;
        const char* env;
        const char* flags;
    } cases[] = {
        {"Mozilla/5.0 (iPad; CPU OS 17_0) AppleWebKit/605.1.15", "{}", "MDI--P--WS"},
        {"Mozilla/5.0 (iPhone; CPU iPhone OS 17_0) AppleWebKit/605.1.15", "{}", "MDI-----WS"},
        {"Mozilla/5.0 (iPod touch) AppleWebKit/605", "{}", "MDI-----WS"},
        {"Mozilla/5.0 (Linux; Android 14) AppleWebKit/537.36 Chrome/120", "{}", "MD-A----WS"},
        {"Opera/9.80 (iPad; Opera Mini/7)", "{}", "MDI--P----"},
        {"Opera/9.80 (Android; Opera Mini/7)", "{}", "MD-A------"},
        {"Mozilla/5.0 (PlayBook; U; RIM Tablet OS 2.1.0) AppleWebKit/536.2+", "{}", "MD----B-WS"},
        {"Mozilla/5.0 (PlayBook)", "{}", "MD----B---"},
        {"Mozilla/5.0 (BlackBerry; U; BlackBerry 9800) AppleWebKit/534.1+", "{}", "MD-----KWS"},
        {"BlackBerry9000/4.6.0.167", "{}", "MD--------"},
        {"Mozilla/4.0 (compatible; MSIE 6.0; Windows CE; IEMobile 7.11)", "{}", "MD--E-----"},
        {"Mozilla/5.0 (X11; Linux x86_64) AppleWebKit/537.36 Chrome/120", "{}", "--------W-"},
        {"Mozilla/4.0 (compatible; MSIE 8.0; Windows NT 6.1)", "{}", "----------"},
        {"Mozilla/5.0 (X11; Linux x86_64; rv:120.0) Gecko/20100101 Firefox/120.0", "{}", "----------"},
        {"NOKIA SYMBIANOS", "{}", "MD--------"},
        {"mIxEd iPhOnE aNdRoId", "{}", "MDI-------"},
        {"", "{}", "----------"},
        {nullptr, R"({"HTTP_X_WAP_PROFILE": "x", "HTTP_UA_OS": "y"})", "----------"},
        {"Mozilla/5.0 (X11)", R"({"HTTP_UA_OS": "x"})", "MD--------"},
        {"Mozilla/5.0 (X11)", R"({"HTTP_X_WAP_PROFILE": "x"})", "MD--------"},
        {"AppleWebKit MSIE", R"({"HTTP_UA_OS": "x"})", "MD--E---W-"},
        {iphone, R"({"HTTP_COOKIE": "forceDesktop=1"})", "-DI-----WS"},
        {iphone, R"({"HTTP_COOKIE": "forceDesktop=-2x"})", "-DI-----WS"},
        {iphone, R"({"HTTP_COOKIE": "forceDesktop=99999999999999999999999"})", "-DI-----WS"},
        {iphone, R"({"HTTP_COOKIE": "forceDesktop=0"})", "MDI-----WS"},
        {iphone, R"({"HTTP_COOKIE": "forceDesktop=yes"})", "MDI-----WS"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.ua ? c.ua : "(none)") + " " + c.env);
        EXPECT_EQ(c.flags, FlagsFor(c.ua ? Json::Value(c.ua) : Json::Value(), c.env));
    }
}

TEST(RequestClient, ClassifiedOnceAndFrozen)
{
    APIRequest r(J(R"j({"environ": {"HTTP_USER_AGENT": "Mozilla/5.0 (X11)"}})j"));
    EXPECT_FALSE(r.IsMobile());
    r.InitEnv(J(R"j({"HTTP_USER_AGENT": "Mozilla/5.0 (iPhone) AppleWebKit"})j"));
    EXPECT_FALSE(r.IsMobile());
    EXPECT_FALSE(r.IsIPhone());
    APIRequest copy(r);
    EXPECT_FALSE(copy.IsIPhone());
}

TEST(RequestClient, HostileUserAgentsAreClassifiedWithoutHarm)
{
    std::string binary;
    for (int i = 0; i < 256; ++i) {
        binary += static_cast<char>(i);
    }
    EXPECT_EQ("MDI-------", FlagsFor(binary + "iphone"));
    EXPECT_EQ("MDI-------", FlagsFor(std::string(1 << 20, 'x') + "iPhone"));
}

namespace {

APIRequest WithEnv(const Json::Value& env)
{
    Json::Value request(Json::objectValue);
    request["environ"] = env;
    return APIRequest(request);
}

}  // namespace

// Only the exact names; a later merge derives it again, but an unknown name
// keeps the old.
TEST(RequestMethod, ExactNamesOnly)
{
    EXPECT_EQ(VELA::REQUEST_METHOD_GET, WithEnv(J(R"({"REQUEST_METHOD": "GET"})")).GetRequestMethod());
    EXPECT_EQ(VELA::REQUEST_METHOD_POST, WithEnv(J(R"({"REQUEST_METHOD": "POST"})")).GetRequestMethod());
    EXPECT_EQ(VELA::REQUEST_METHOD_HEAD, WithEnv(J(R"({"REQUEST_METHOD": "HEAD"})")).GetRequestMethod());
    EXPECT_EQ(0, WithEnv(J(R"({"REQUEST_METHOD": "get"})")).GetRequestMethod());
    EXPECT_EQ(0, WithEnv(J(R"({"REQUEST_METHOD": "PUT"})")).GetRequestMethod());
    APIRequest r = WithEnv(J(R"({"REQUEST_METHOD": "GET"})"));
    r.InitEnv(J(R"({"REQUEST_METHOD": "POST"})"));
    EXPECT_EQ(VELA::REQUEST_METHOD_POST, r.GetRequestMethod());
    r.InitEnv(J(R"({"REQUEST_METHOD": "DELETE"})"));
    EXPECT_EQ(VELA::REQUEST_METHOD_POST, r.GetRequestMethod());
}

// X-Forwarded-Proto counts only when the peer is a configured trusted proxy:
// a client's own header would make the login cookie Secure, or anything
// else that follows the scheme.
TEST_F(RequestUnderRoot, ForwardedSchemeOnlyFromATrustedProxy)
{
    const auto proto = [](const char* remote) {
        Json::Value env = J(R"({"HTTPS": "off", "HTTP_X_FORWARDED_PROTO": "HTTPS"})");
        env["REMOTE_ADDR"] = remote;
        return WithEnv(env).GetURLProto("x");
    };
    EXPECT_EQ("http", proto("127.0.0.1"));  // no proxy configured, loopback included
    Conf("webapi.conf", "trusted_proxies=\"192.0.2.10\"\n");
    EXPECT_EQ("https", proto("192.0.2.10"));
    EXPECT_EQ("http", proto("192.0.2.11"));
    EXPECT_EQ("http", proto("127.0.0.1"));
    EXPECT_EQ("http", WithEnv(J(R"({"HTTP_X_FORWARDED_PROTO": "https"})")).GetURLProto("x"));  // no peer
}

// Scheme, host and port; an unusable host leaves host and port to the
// defaults.
TEST(RequestURL, SchemeHostAndPort)
{
    struct Case {
        const char* env;
        const char* host;
        int port;
        const char* proto;
    } cases[] = {
        {R"({"HTTP_HOST": "myhost", "HTTPS": "on"})", "myhost", 443, "https"},
        {R"({"HTTP_HOST": "myhost", "HTTPS": "ON"})", "myhost", 443, "https"},
        {R"({"HTTP_HOST": "myhost", "HTTPS": "1"})", "myhost", 80, "http"},
        {R"({"HTTP_HOST": "myhost"})", "myhost", 80, "http"},
        {R"({"HTTP_HOST": "10.0.0.5:5001"})", "10.0.0.5", 5001, "http"},
        {R"({"HTTP_HOST": "[fe80::1]:5001"})", "[fe80::1]", 5001, "http"},
        {R"({"HTTP_HOST": "[fe80::1]", "HTTPS": "on"})", "[fe80::1]", 443, "https"},
        {R"({"HTTP_HOST": "[fe80::1]junk"})", "[fe80::1]", 80, "http"},
        {R"({"HTTP_HOST": "fe80::1"})", "fe80:", 1, "http"},
        {R"({"HTTP_HOST": "host:"})", "host", 80, "http"},
        {R"({"HTTP_HOST": "host:abc"})", "host", 0, "http"},
        {R"({"HTTP_HOST": "host:99999999999999999999"})", "host", 0, "http"},
        {R"({"HTTP_HOST": ":"})", "", 80, "http"},
        {R"({"HTTP_HOST": "[::1"})", "dflt", -1, "http"},
        {R"({"HTTP_HOST": ""})", "dflt", -1, "http"},
        {"{}", "dflt", -1, "http"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.env);
        Json::Value env = J(c.env);
        env["REQUEST_URI"] = "/a/b";
        APIRequest r = WithEnv(env);
        EXPECT_EQ(c.host, r.GetURLHost("dflt"));
        EXPECT_EQ(c.port, r.GetURLPort(-1));
        EXPECT_EQ(c.proto, r.GetURLProto("x"));
        EXPECT_EQ("/a/", r.GetURLPath("x"));
    }
    EXPECT_EQ("http", APIRequest().GetURLProto("x"));
}

TEST(RequestURL, PathAndName)
{
    APIRequest a = WithEnv(J(R"({"REQUEST_URI": "/webapi/entry.cgi?api=x/y"})"));
    EXPECT_EQ("/webapi/", a.GetURLPath("d"));
    EXPECT_EQ("entry.cgi", a.GetURLName("d"));
    APIRequest b = WithEnv(J(R"({"REQUEST_URI": "/webapi/"})"));
    EXPECT_EQ("/webapi/", b.GetURLPath("d"));
    EXPECT_EQ("", b.GetURLName("d"));
    APIRequest c = WithEnv(J(R"({"REQUEST_URI": "entry.cgi"})"));
    EXPECT_EQ("d", c.GetURLPath("d"));
    EXPECT_EQ("d", c.GetURLName("d"));
    APIRequest d = WithEnv(J(R"({"REQUEST_URI": "/a/../b//c%2f"})"));
    EXPECT_EQ("/a/../b//", d.GetURLPath("d"));  // no decoding, no normalisation
    EXPECT_EQ("c%2f", d.GetURLName("d"));
}

TEST(RequestURL, FactsAreFrozenAtFirstUse)
{
    APIRequest r = WithEnv(J(R"({"HTTP_HOST": "first:1", "REQUEST_URI": "/a/x"})"));
    EXPECT_EQ("first", r.GetURLHost(""));
    r.InitEnv(J(R"({"HTTP_HOST": "second:2", "REQUEST_URI": "/b/y", "HTTPS": "on"})"));
    EXPECT_EQ("first", r.GetURLHost(""));
    EXPECT_EQ(1, r.GetURLPort(0));
    EXPECT_EQ("/a/", r.GetURLPath(""));
    EXPECT_EQ("http", r.GetURLProto(""));
}

// An address stored in the request wins over the platform's; the platform is
// asked once and its answer kept, but an unknown address is asked again.
TEST_F(RequestUnderRoot, RemoteIPStoredAskedOnceOrRetried)
{
    VELA::Test::ScopedEnv forwarded("HTTP_X_FORWARDED_FOR", nullptr);
    APIRequest r;
    APIRequest unknown;
    {
        VELA::Test::ScopedEnv remote("REMOTE_ADDR", "192.0.2.7");
        EXPECT_EQ("198.51.100.1", WithEnv(J(R"({"vela_remoteIP": "198.51.100.1"})")).GetRemoteIP());
        EXPECT_EQ("192.0.2.7", r.GetRemoteIP());
    }
    {
        VELA::Test::ScopedEnv remote("REMOTE_ADDR", nullptr);
        EXPECT_EQ("", unknown.GetRemoteIP());
        EXPECT_FALSE(unknown.HasEnv("vela_remoteIP"));
    }
    VELA::Test::ScopedEnv remote("REMOTE_ADDR", "2001:db8::1");
    EXPECT_EQ("192.0.2.7", r.GetRemoteIP());
    EXPECT_EQ("192.0.2.7", r.GetEnv("vela_remoteIP").asString());
    EXPECT_EQ("2001:db8::1", unknown.GetRemoteIP());
}
