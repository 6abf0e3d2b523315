// Runs a piece of a test in a forked child with its own standard input and
// output, as the web server runs velascgi.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <functional>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

// `child` runs with `input` on its standard input (then end of file); the
// child's standard output is returned once it has exited.
inline std::string RunChild(const std::string& input, const std::function<void()>& child)
{
    int in[2];
    int out[2];
    if (pipe(in) != 0 || pipe(out) != 0) {
        ADD_FAILURE() << "pipe";
        return "";
    }
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(in[0], STDIN_FILENO);
        dup2(out[1], STDOUT_FILENO);
        for (int fd : {in[0], in[1], out[0], out[1]}) {
            close(fd);
        }
        child();
        _exit(0);
    }
    close(in[0]);
    close(out[1]);
    (void)!write(in[1], input.data(), input.size());  // small inputs: fits the pipe
    close(in[1]);
    std::string text;
    char buf[4096];
    for (ssize_t n; (n = read(out[0], buf, sizeof(buf))) > 0;) {
        text.append(buf, static_cast<size_t>(n));
    }
    close(out[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    return text;
}

// The path of the program `name` of the build (VELA_TEST_BINARY_DIR).
inline std::string BuiltProgram(const std::string& name)
{
    const char* dir = getenv("VELA_TEST_BINARY_DIR");
    return std::string(dir != nullptr ? dir : ".") + "/" + name;
}

// Runs `program` with exactly `env` as its environment and `input` on its
// standard input; its standard output.
inline std::string RunWithEnv(const std::string& program, std::vector<std::string> env, const std::string& input)
{
    return RunChild(input, [&] {
        std::vector<char*> envp;
        for (std::string& e : env) {
            envp.push_back(&e[0]);
        }
        envp.push_back(nullptr);
        char* argv[] = {const_cast<char*>(program.c_str()), nullptr};
        execve(program.c_str(), argv, envp.data());
        _exit(127);
    });
}
