// Web-server restart: the signal reaches only a process that the pid file
// names and that carries the configured name.

#include <csignal>
#include <memory>
#include <sys/prctl.h>

#include "platform/PlatformTest.h"
#include "vela/webserver.h"

namespace {

const char kServerName[] = "velatesthttpd";

// A child that waits with SIGUSR1 blocked, optionally renamed to `name`,
// until Finish() asks whether the signal arrived.
class Child {
public:
    explicit Child(const char* name)
    {
        sigset_t usr1, old;
        sigemptyset(&usr1);
        sigaddset(&usr1, SIGUSR1);
        sigprocmask(SIG_BLOCK, &usr1, &old);
        child_ = std::make_unique<VELA::Test::Children>(1, [&](int) {
            if (name != nullptr) {
                prctl(PR_SET_NAME, name, 0, 0, 0);
            }
            ready_.Post();
            go_.Wait();
            sigset_t pending;
            sigpending(&pending);
            return sigismember(&pending, SIGUSR1) ? 1 : 0;
        });
        sigprocmask(SIG_SETMASK, &old, nullptr);
        EXPECT_EQ('y', ready_.Wait());
    }
    pid_t Pid() const { return child_->Pid(0); }
    // True when the child saw SIGUSR1 pending.
    bool Finish()
    {
        go_.Post();
        return child_->Wait() == std::vector<int>{1};
    }

private:
    const VELA::Test::Gate ready_, go_;
    std::unique_ptr<VELA::Test::Children> child_;
};

class WebServer : public RootTest {
protected:
    WebServer()
    {
        mkdir(In("/run").c_str(), 0755);
        Conf("webapi.conf", std::string("httpd_name=\"") + kServerName + "\"\nhttpd_pidfile=\"/run/test.pid\"\n");
    }
    void PidFile(const std::string& text, mode_t mode = 0644)
    {
        unlink(In("/run/test.pid").c_str());
        VELA::Test::WriteFile(In("/run/test.pid"), text, mode);
    }
    bool Restart()
    {
        velaw3::Engine engine;
        velaw3::TARN tarn(engine);
        return tarn.RestartService();
    }
};

TEST_F(WebServer, SignalsOnlyTheConfiguredServer)
{
    Child other(nullptr);
    PidFile(std::to_string(other.Pid()) + "\n");
    VELA::Test::LogCapture log;
    EXPECT_FALSE(Restart());
    EXPECT_TRUE(log.Contains("not restarted"));
    EXPECT_FALSE(other.Finish());

    Child server(kServerName);
    PidFile(std::to_string(server.Pid()) + "\n");
    EXPECT_TRUE(Restart());
    EXPECT_TRUE(server.Finish());
}

TEST_F(WebServer, RefusesUntrustworthyPidFilesAndConfiguration)
{
    Child server(kServerName);
    const std::string pid = std::to_string(server.Pid());
    VELA::Test::Children goneChild(1, [](int) { return 0; });
    const pid_t gone = goneChild.Pid(0);
    goneChild.Wait();

    for (const std::string& text : {std::string(""), std::string("abc"), std::string("0"), std::string("1"),
                                    std::string("-5"), pid + " 7", "+" + pid, std::to_string(gone)}) {
        PidFile(text);
        EXPECT_FALSE(Restart()) << "pid file \"" << text << "\"";
    }
    PidFile(pid, 0666);  // anyone could have written it
    EXPECT_FALSE(Restart());
    PidFile(pid);
    ASSERT_EQ(0, symlink(In("/run/test.pid").c_str(), In("/run/link.pid").c_str()));
    Conf("webapi.conf", std::string("httpd_name=\"") + kServerName + "\"\nhttpd_pidfile=\"/run/link.pid\"\n");
    EXPECT_FALSE(Restart());
    for (const char* bad : {"httpd_name=\"a/b\"\nhttpd_pidfile=\"/run/test.pid\"\n",
                            "httpd_name=\"velatesthttpd\"\nhttpd_pidfile=\"run/test.pid\"\n",
                            "httpd_name=\"velatesthttpd\"\nhttpd_pidfile=\"/run/../run/test.pid\"\n",
                            "httpd_name=\"velatesthttpd\"\nhttpd_pidfile=\"/run/test.pid\"\nhttpd_restart_signal=KILL\n",
                            "httpd_name=\"unterminated\n"}) {
        Conf("webapi.conf", bad);
        velaw3::Engine engine;
        EXPECT_FALSE(engine.IsValid()) << bad;
        EXPECT_FALSE(velaw3::TARN(engine).RestartService()) << bad;
    }
    EXPECT_FALSE(server.Finish());
}

}  // namespace
