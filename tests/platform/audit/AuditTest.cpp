// The audit trail in a temporary root: the line and its twin in syslog,
// hostile texts kept on one bounded line, the platform's session and token
// events without a secret, whole lines from writers in several processes,
// no write through a symbolic link or into a FIFO, the modes and owner of
// what it creates, and the facts taken from the call being served.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <json/json.h>
#include <memory>
#include <pwd.h>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "platform/StateRootTest.h"
#include "support/TestSupport.h"
#include "vela/audit.h"
#include "vela/log.h"
#include "vela/session.h"
#include "vela/token.h"

namespace {

using VELA::Audit::Event;

class Audit : public StateRootTest {
protected:
    std::string LogPath() const { return In("/var/log/vela/audit.log"); }

    std::vector<std::string> Lines() const
    {
        std::vector<std::string> out;
        const std::string text = VELA::Test::ReadText(LogPath());
        size_t start = 0;
        for (size_t nl = text.find('\n'); nl != std::string::npos; nl = text.find('\n', start)) {
            out.push_back(text.substr(start, nl - start));
            start = nl + 1;
        }
        EXPECT_EQ(text.size(), start) << "the file ends in the middle of a line";
        return out;
    }

    static Json::Value Parse(const std::string& line)
    {
        Json::Value v;
        Json::CharReaderBuilder builder;
        std::string errors;
        std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
        EXPECT_TRUE(reader->parse(line.data(), line.data() + line.size(), &v, &errors)) << line << errors;
        return v;
    }

    // Printable ASCII only: nothing a terminal or a log reader could take
    // for a line break or a control sequence.
    static bool PlainAscii(const std::string& line)
    {
        for (unsigned char c : line) {
            if (c < 0x20 || c >= 0x7f) {
                return false;
            }
        }
        return true;
    }

    static Event Sample(const std::string& user)
    {
        Event e;
        e.name = VELA::Audit::kLoginFailed;
        e.user = user;
        e.address = "192.0.2.7";
        e.api = "VELA.Auth";
        e.method = "login";
        e.result = 400;
        return e;
    }
};

TEST_F(Audit, OneLineToTheFileAndTheSameToSyslog)
{
    VELA::Test::LogCapture log;
    const long long before = time(nullptr);
    VELA::Audit::Record(Sample("alice"));
    const std::vector<std::string> lines = Lines();
    ASSERT_EQ(1u, lines.size());
    const Json::Value v = Parse(lines[0]);
    EXPECT_EQ("login-failed", v["event"].asString());
    EXPECT_EQ("alice", v["user"].asString());
    const struct passwd* me = getpwuid(getuid());  // outside a call: who runs the process
    ASSERT_NE(nullptr, me);
    EXPECT_EQ(me->pw_name, v["actor"].asString());
    EXPECT_EQ("192.0.2.7", v["address"].asString());
    EXPECT_EQ("VELA.Auth", v["api"].asString());
    EXPECT_EQ("login", v["method"].asString());
    EXPECT_EQ(400, v["result"].asInt());
    EXPECT_FALSE(v.isMember("truncated"));
    EXPECT_FALSE(v.isMember("tokenId"));
    const long long epoch = v["epoch"].asInt64();
    EXPECT_LE(before, epoch);
    EXPECT_LE(epoch, time(nullptr));
    const time_t t = static_cast<time_t>(epoch);
    struct tm tm;
    char iso[32];
    ASSERT_NE(nullptr, gmtime_r(&t, &tm));
    strftime(iso, sizeof(iso), "%Y-%m-%dT%H:%M:%SZ", &tm);
    EXPECT_EQ(iso, v["time"].asString());

    EXPECT_EQ(LOG_AUTHPRIV | LOG_NOTICE, log.PriorityOf({"audit: " + lines[0]}));

    // The directory 0750 and the file 0640 whatever the umask; owned by the
    // writer (root on a real system).
    struct stat st;
    ASSERT_EQ(0, stat(In("/var/log/vela").c_str(), &st));
    EXPECT_EQ(0750u, st.st_mode & 07777);
    ASSERT_EQ(0, stat(LogPath().c_str(), &st));
    EXPECT_EQ(0640u, st.st_mode & 07777);
    EXPECT_EQ(geteuid(), st.st_uid);

    // Appended, never replaced; a file made too open is put back to 0640.
    ASSERT_EQ(0, chmod(LogPath().c_str(), 0666));
    VELA::Audit::Record(Sample("bob"));
    ASSERT_EQ(2u, Lines().size());
    EXPECT_EQ("bob", Parse(Lines()[1])["user"].asString());
    ASSERT_EQ(0, stat(LogPath().c_str(), &st));
    EXPECT_EQ(0640u, st.st_mode & 07777);
}

// Whatever a client puts in a name or an address stays inside its string
// on one line of printable ASCII, and reads back as it was sent.
TEST_F(Audit, HostileTextsStayOnOneBoundedLine)
{
    const std::string hostile[] = {
        std::string("eve\n{\"event\":\"login\",\"user\":\"root\"}"),
        std::string("a\"b\\c\r\td\x01\x1b[31m\x7f"),
        std::string("caf\xc3\xa9 \xe2\x80\xae"),  // UTF-8, a right-to-left override among it
    };
    for (const std::string& text : hostile) {
        Event e = Sample(text);
        e.address = text;
        e.method = text;
        const std::string line = VELA::Audit::FormatLine(e, 1700000000);
        EXPECT_TRUE(PlainAscii(line)) << line;
        const Json::Value v = Parse(line);
        EXPECT_EQ(text, v["user"].asString());
        EXPECT_EQ(text, v["method"].asString());
        EXPECT_EQ("login-failed", v["event"].asString());
    }

    // Invalid UTF-8 still gives valid JSON.
    const Json::Value broken = Parse(VELA::Audit::FormatLine(Sample("\xff\xc3(\xe2\x80"), 1700000000));
    EXPECT_TRUE(broken["user"].isString());

    // Texts far too long are cut, at a character boundary, and the line says
    // so; the worst escaping (6 bytes per byte) still fits.
    for (const std::string& big : {std::string(100000, '\x01'), std::string(100000, 'x'),
                                   [] {
                                       std::string s;
                                       for (int i = 0; i < 50000; ++i) {
                                           s += "\xc3\xa9";
                                       }
                                       return s;
                                   }()}) {
        Event e = Sample(big);
        e.actor = big;
        e.address = big;
        e.api = big;
        e.method = big;
        const std::string line = VELA::Audit::FormatLine(e, 1700000000);
        EXPECT_LE(line.size(), VELA::Audit::kMaxLine);
        const Json::Value v = Parse(line);
        EXPECT_TRUE(v["truncated"].asBool());
        const std::string user = v["user"].asString();
        EXPECT_FALSE(user.empty());
        EXPECT_EQ(0, big.compare(0, user.size(), user)) << "not a prefix of what was sent";
        EXPECT_EQ(400, v["result"].asInt());
    }

    // Through Record, the syslog twin is the whole line too.
    VELA::Test::LogCapture log;
    Event e = Sample(std::string(5000, '\n'));
    VELA::Audit::Record(e);
    ASSERT_EQ(1u, Lines().size());
    EXPECT_NE(-1, log.PriorityOf({"audit: " + Lines()[0]}));
}

// Sessions and tokens made and revoked through the platform leave their
// events, with the user and the token's id, never the session id, the
// anti-forgery token or the token's secret.
TEST_F(Audit, SessionAndTokenEventsHoldNoSecret)
{
    std::string sid;
    std::string csrf;
    ASSERT_EQ(0, VELA::Session::Create("root", "192.0.2.9", nullptr, sid, csrf));
    std::string sid2;
    std::string csrf2;
    VELA::Session::Options login;
    login.auditEvent = VELA::Audit::kLogin;
    ASSERT_EQ(0, VELA::Session::Create("root", "192.0.2.9", &login, sid2, csrf2));
    ASSERT_EQ(0, VELA::Session::Remove(sid.c_str()));
    ASSERT_EQ(0, VELA::Session::Remove(sid2.c_str(), VELA::Audit::kLogout));
    EXPECT_EQ(-2, VELA::Session::Remove(sid.c_str()));  // nothing removed, nothing recorded

    std::string token;
    std::string id;
    ASSERT_EQ(0, VelaAccessTokenCreate("root", {"VELA.Sample"}, {"*"}, 0, token, id));
    ASSERT_EQ(0, VelaAccessTokenRevoke(token.c_str()));
    const std::string secret = token.substr(token.find('.') + 1);

    // Sessions that expire are purged without an event.
    Now() += VELA_SESSION_LIFETIME_MAX;
    std::string sid3;
    std::string csrf3;
    ASSERT_EQ(0, VELA::Session::Create("root", nullptr, nullptr, sid3, csrf3));
    Now() += 2 * VELA_SESSION_LIFETIME_MAX;
    ASSERT_EQ(1, VELA::Session::Purge(0));

    const std::vector<std::string> lines = Lines();
    ASSERT_EQ(7u, lines.size());
    const char* const events[] = {"session-create", "login",       "session-revoke", "logout",
                                  "token-create",   "token-revoke", "session-create"};
    for (size_t i = 0; i < lines.size(); ++i) {
        const Json::Value v = Parse(lines[i]);
        EXPECT_EQ(events[i], v["event"].asString()) << lines[i];
        EXPECT_EQ("root", v["user"].asString()) << lines[i];
        EXPECT_EQ(0, v["result"].asInt());
        for (const std::string& secretText : {sid, csrf, sid2, csrf2, secret, sid3, csrf3}) {
            EXPECT_EQ(std::string::npos, lines[i].find(secretText)) << lines[i];
        }
    }
    EXPECT_EQ(id, Parse(lines[4])["tokenId"].asString());
    EXPECT_EQ(id, Parse(lines[5])["tokenId"].asString());
}

// Writers in several processes at once: every line whole, none lost.
TEST_F(Audit, ConcurrentWritersGiveWholeLines)
{
    constexpr int kWriters = 6;
    constexpr int kEach = 150;
    std::vector<pid_t> pids;
    for (int w = 0; w < kWriters; ++w) {
        const pid_t pid = fork();
        ASSERT_NE(-1, pid);
        if (pid == 0) {
            VELA::System::LogSetSink([](int, const char*, void*) {}, nullptr);  // keep syslog quiet
            // Long lines, so that a split write would show.
            const std::string user = std::string(200, static_cast<char>('a' + w)) + "\n\x01";
            for (int i = 0; i < kEach; ++i) {
                Event e = Sample(user);
                e.result = i;
                e.method = std::string(100, 'm');
                VELA::Audit::Record(e);
            }
            _exit(0);
        }
        pids.push_back(pid);
    }
    for (pid_t pid : pids) {
        int status = 0;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    const std::vector<std::string> lines = Lines();
    ASSERT_EQ(static_cast<size_t>(kWriters * kEach), lines.size());
    std::vector<std::vector<int>> seen(kWriters);
    for (const std::string& line : lines) {
        const Json::Value v = Parse(line);
        const std::string user = v["user"].asString();
        ASSERT_EQ(202u, user.size()) << line;
        const int w = user[0] - 'a';
        ASSERT_TRUE(w >= 0 && w < kWriters) << line;
        EXPECT_EQ(std::string(200, user[0]) + "\n\x01", user);
        seen[w].push_back(v["result"].asInt());
    }
    for (int w = 0; w < kWriters; ++w) {
        ASSERT_EQ(static_cast<size_t>(kEach), seen[w].size());
        for (int i = 0; i < kEach; ++i) {
            EXPECT_EQ(i, seen[w][i]) << "writer " << w;  // each process's lines in its order
        }
    }
}

// A symbolic link or a FIFO planted at audit.log is never written through,
// and the call does not block or fail; the refusal is logged.
TEST_F(Audit, NoWriteThroughALinkOrIntoAFifo)
{
    ASSERT_EQ(0, system(("mkdir -p '" + In("/var/log/vela") + "'").c_str()));
    const std::string target = In("/target");
    { std::ofstream(target) << ""; }
    ASSERT_EQ(0, symlink(target.c_str(), LogPath().c_str()));
    {
        VELA::Test::LogCapture log;
        VELA::Audit::Record(Sample("mallory"));
        EXPECT_TRUE(log.Contains("audit: open(")) << "the refusal is logged";
        EXPECT_NE(-1, log.PriorityOf({"audit: {"})) << "syslog still has the event";
    }
    EXPECT_EQ("", VELA::Test::ReadText(target));

    ASSERT_EQ(0, unlink(LogPath().c_str()));
    ASSERT_EQ(0, mkfifo(LogPath().c_str(), 0600));
    VELA::Test::LogCapture log;
    VELA::Audit::Record(Sample("mallory"));  // would hang if it waited for a reader
    EXPECT_TRUE(log.Contains("audit: open("));
}

// A process running as another user (saved user id 0, as the dispatcher
// leaves it) still writes the file as root, then is that user again.
TEST_F(Audit, WritesAsRootAfterAnIdentitySwitch)
{
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root";
    }
    const struct passwd* nobody = getpwnam("nobody");
    ASSERT_NE(nullptr, nobody);
    const uid_t uid = nobody->pw_uid;
    const gid_t gid = nobody->pw_gid;
    const pid_t pid = fork();
    ASSERT_NE(-1, pid);
    if (pid == 0) {
        if (setresgid(static_cast<gid_t>(-1), gid, static_cast<gid_t>(-1)) != 0 ||
            setresuid(static_cast<uid_t>(-1), uid, static_cast<uid_t>(-1)) != 0) {
            _exit(2);
        }
        VELA::Audit::Record(Sample("carol"));
        _exit(geteuid() == uid && getegid() == gid ? 0 : 3);
    }
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    ASSERT_EQ(1u, Lines().size());
    struct stat st;
    ASSERT_EQ(0, stat(LogPath().c_str(), &st));
    EXPECT_EQ(0u, st.st_uid);
    EXPECT_EQ(0u, st.st_gid);
    ASSERT_EQ(0, stat(In("/var/log/vela").c_str(), &st));
    EXPECT_EQ(0u, st.st_uid);
}

// Facts left empty come from the call being served; the actor is dropped
// when it is the user; with no call, the actor is the real user's account.
TEST_F(Audit, FactsOfTheCallBeingServed)
{
    struct Facts {
        static void Fill(const void* arg, VELA::Audit::CallFacts& out)
        {
            ++*static_cast<int*>(const_cast<void*>(arg));
            out.actor = "admin";
            out.address = "2001:db8::1";
            out.api = "VELA.Admin";
            out.method = "revoke";
        }
    };
    int asked = 0;
    const VELA::Audit::CallSource old = VELA::Audit::SetCallSource({&Facts::Fill, &asked});
    Event e;
    e.name = VELA::Audit::kSessionRevoke;
    e.user = "alice";
    Json::Value v = Parse(VELA::Audit::FormatLine(e, 1700000000));
    EXPECT_EQ(1, asked);
    EXPECT_EQ("admin", v["actor"].asString());
    EXPECT_EQ("2001:db8::1", v["address"].asString());
    EXPECT_EQ("VELA.Admin", v["api"].asString());
    EXPECT_EQ("revoke", v["method"].asString());
    EXPECT_EQ("2023-11-14T22:13:20Z", v["time"].asString());

    e.user = "admin";  // the administrator's own session
    e.address = "192.0.2.1";  // given: kept
    v = Parse(VELA::Audit::FormatLine(e, 1700000000));
    EXPECT_EQ("", v["actor"].asString());
    EXPECT_EQ("192.0.2.1", v["address"].asString());
    EXPECT_EQ("VELA.Admin", v["api"].asString());

    VELA::Audit::SetCallSource(old);
    e.user = "alice";
    v = Parse(VELA::Audit::FormatLine(e, 1700000000));
    const struct passwd* me = getpwuid(getuid());
    ASSERT_NE(nullptr, me);
    EXPECT_EQ(std::string(me->pw_name) == "alice" ? "" : me->pw_name, v["actor"].asString());
    EXPECT_EQ("", v["api"].asString());
    EXPECT_EQ(2, asked);
}

}  // namespace
