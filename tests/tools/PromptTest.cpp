// The prompt of the command line tool, through a terminal of the test's own.
#include <gtest/gtest.h>
#include <poll.h>
#include <pty.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>

#include "Support.h"

namespace Korvel {
namespace {

using Test::HostProcess;
using Test::TempDir;

constexpr int kDeadlineSeconds = 60;

// A running tool, and what it has shown so far.
class Terminal {
public:
    Terminal(const TempDir& home, std::vector<std::string> args = {}) {
        std::vector<char*> argv;
        args.insert(args.begin(), OXSCRIPT);
        for (std::string& arg : args) argv.push_back(arg.data());
        argv.push_back(nullptr);
        winsize size = {50, 200, 0, 0};  // no line is wrapped
        m_Pid = forkpty(&m_Terminal, nullptr, nullptr, &size);
        if (m_Pid == 0) {
            setenv("XDG_STATE_HOME", home.Path("a/b").c_str(), 1);
            setenv("TERM", "xterm", 1);
            setenv("LC_ALL", "C", 1);
            execv(argv[0], argv.data());
            _exit(127);
        }
    }
    ~Terminal() {
        close(m_Terminal);
        if (m_Pid > 0) {
            kill(m_Pid, SIGKILL);
            waitpid(m_Pid, nullptr, 0);
        }
    }

    void Type(const std::string& text) {
        ASSERT_EQ(write(m_Terminal, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }

    // Types a line at the prompt and returns what is shown from the echo to the next prompt.
    std::string Run(const std::string& line, const std::string& prompt = "> ") {
        Type(line + "\r");
        return WaitFor("\n" + prompt);
    }

    // Waits until a text is shown. Returns what was shown up to its end, without what moves the
    // cursor, and forgets it. At the end of the tool that is all there is.
    std::string WaitFor(const std::string& text) {
        using Clock = std::chrono::steady_clock;
        Clock::time_point deadline = Clock::now() + std::chrono::seconds(kDeadlineSeconds);
        size_t found;
        while ((found = m_Shown.find(text)) == m_Shown.npos || text.empty()) {
            auto left =
                std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
            pollfd reader = {m_Terminal, POLLIN, 0};
            char block[4096];
            ssize_t count = 0;
            if (left.count() > 0 && poll(&reader, 1, static_cast<int>(left.count())) > 0) {
                count = read(m_Terminal, block, sizeof(block));
            }
            if (count <= 0) {
                if (!text.empty()) ADD_FAILURE() << "'" << text << "' is not in: " << m_Shown;
                return std::exchange(m_Shown, "");
            }
            Show(std::string(block, static_cast<size_t>(count)));
        }
        std::string shown = m_Shown.substr(0, found + text.size());
        m_Shown.erase(0, shown.size());
        return shown;
    }

    // The exit status, once the tool has left by itself.
    int Wait() {
        WaitFor("");
        int status = 0;
        waitpid(std::exchange(m_Pid, -1), &status, 0);
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

private:
    void Show(const std::string& bytes) {
        for (char c : bytes) {
            if (m_IsEscape) {
                m_IsEscape = c == '[' || c == '?' || isdigit(c) || c == ';';
            } else if (c == '\x1b') {
                m_IsEscape = true;
            } else if (c != '\r' && c != '\a') {
                m_Shown += c;
            }
        }
    }

    int m_Terminal = -1;
    pid_t m_Pid;
    std::string m_Shown;
    bool m_IsEscape = false;
};

class Prompt : public testing::Test {
protected:
    TempDir m_Home;
};

bool Contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

TEST_F(Prompt, ShowsValues) {
    Terminal terminal(m_Home);
    EXPECT_TRUE(Contains(terminal.WaitFor("> "), "LuaJIT"));
    struct Case {
        const char* line;
        const char* shown;
    };
    const Case cases[] = {
        {"1 + 1", "\n2\n> "},
        {"= 'a', nil, 7 -- three", "\na\tnil\t7\n> "},
        {"x = 3", "x = 3\n> "},                        // nothing to show
        {"x", "\n3\n> "},                              // kept from line to line
        {"nothing", "\nnil\n> "},                      // a value like others
        {"print('once')", "print('once')\nonce\n> "},  // no value, so no line for it
        {"print('once');", "print('once');\nonce\n> "},
        {"#arg", "\n0\n> "},  // no comment, as it would be in a file
        {"'\xc3\xa4\xe2\x82\xac'", "\n\xc3\xa4\xe2\x82\xac\n> "},
        {"", "\n> "},
    };
    for (const Case& c : cases) EXPECT_TRUE(terminal.Run(c.line).ends_with(c.shown)) << c.line;
    terminal.Type("\x04");
    EXPECT_EQ(terminal.Wait(), 0);
}

TEST_F(Prompt, GoesOnUntilInputIsWhole) {
    Terminal terminal(m_Home, {"-q"});
    EXPECT_EQ(terminal.WaitFor("> "), "> ");
    terminal.Run("for i = 1, 2 do", ">> ");
    terminal.Run("print('line', i)", ">> ");
    EXPECT_TRUE(Contains(terminal.Run("end"), "line\t1\nline\t2\n"));
    terminal.Run("'a' .. [[", ">> ");
    EXPECT_TRUE(Contains(terminal.Run("\tb]]"), "\na    b\n"));  // Tab indents
    terminal.Run("f(", ">> ");
    terminal.Type("1, \x03");  // Ctrl-C drops all of it
    terminal.WaitFor("\n> ");
    EXPECT_TRUE(Contains(terminal.Run("'a'"), "\na\n"));
    terminal.Run("os.exit(", ">> ");
    terminal.Type("6)\r");
    EXPECT_EQ(terminal.Wait(), 6);
}

TEST_F(Prompt, SurvivesErrors) {
    Terminal terminal(m_Home, {"-q", "-i", "-e", "local function f() error('told') end x = f"});
    terminal.WaitFor("> ");
    std::string shown = terminal.Run("x()");
    EXPECT_TRUE(Contains(shown, "\n(command line):1: told\nstack traceback:\n")) << shown;
    EXPECT_TRUE(Contains(shown, "stdin:1: in main chunk")) << shown;
    shown = terminal.Run("if then");
    EXPECT_TRUE(Contains(shown, "\nstdin:1: unexpected symbol near 'then'\n> ")) << shown;
    EXPECT_TRUE(Contains(terminal.Run("x ~= nil"), "\ntrue\n"));
}

TEST_F(Prompt, SeesWhatAFileDefines) {
    std::string file = m_Home.Write("f=1.lua", "#!/bin/sh\nmine = arg[0]; globals.ours = arg.n\n");
    Terminal terminal(m_Home, {"-i", file, "a"});
    terminal.WaitFor("> ");
    EXPECT_TRUE(Contains(terminal.Run("mine, ours"), "\n" + file + "\t1\n"));
}

TEST_F(Prompt, CompletesNames) {
    Terminal terminal(m_Home);
    terminal.WaitFor("> ");
    struct Case {
        const char* typed;
        const char* completed;
    };
    const Case cases[] = {
        {"string.for\t", "string.format"},
        {"contin\t", "continent"},
        {"loc\t", "local"},
        {"object.inh\t", "object.inherited"},  // through the metatable
        {"('x' .. text:uppe\t", "('x' .. text:upper"},
        {"no.such.thi\t", "no.such.thi"},
        {"f().for\t", "f().for"},
        {"1 ..conti\t", "1 ..continent"},
    };
    terminal.Run("continent = 1 text = '' object = setmetatable({}, {__index = {inherited = 1}})");
    for (const Case& c : cases) {
        terminal.Type(std::string(c.typed) + "|\x03");  // the bar stands behind what was completed
        std::string shown = terminal.WaitFor("\n> ");
        EXPECT_TRUE(Contains(shown, std::string(c.completed) + "|")) << c.completed << shown;
    }
    terminal.Type("coroutine.\t");
    EXPECT_TRUE(Contains(terminal.WaitFor("> coroutine."), "create"));
}

TEST_F(Prompt, CompletesMembersOfObjects) {
    HostProcess host(MEDIAHOST);
    Terminal terminal(m_Home, {"-a", std::to_string(host.GetPort())});
    terminal.WaitFor("> ");
    struct Case {
        const char* typed;
        const char* shown;
    };
    const Case cases[] = {{"app.Timel\t", "app.Timeline"},
                          {"app.Timeline:GetCl\t", "app.Timeline:GetClips"},
                          {"app.Timeline.Dur\t", "app.Timeline.Duration"},
                          {"app:GetTimeo\t", "app:GetTimeout"},
                          {"app:Cli\t", "app:Clip"},    // makes one
                          {"app:Titl\t", "app:Titl"}};  // no function
    for (const Case& c : cases) {
        terminal.Type(std::string("--") + c.typed + "<\r");
        std::string shown = terminal.WaitFor("\n> ");
        EXPECT_TRUE(Contains(shown, std::string(c.shown) + "<")) << shown;
    }
    terminal.Type("app.Ti\t");
    EXPECT_TRUE(Contains(terminal.WaitFor("> app.Ti"), "Timeline  Title"));
    terminal.Type("\x03");
    terminal.WaitFor("\n> ");
    EXPECT_TRUE(Contains(terminal.Run("app:Clip('x', 0)"), "\nMediaHost: A clip takes"));
    EXPECT_TRUE(Contains(terminal.Run("app.ClassName"), "\nMediaHost\n"));
}

TEST_F(Prompt, StopsAScriptAndKeepsTheRest) {
    Terminal terminal(m_Home);
    terminal.WaitFor("> ");
    terminal.Run("x = 41");
    const char* const loops[] = {"while true do end",
                                 "coroutine.wrap(function() repeat until nil end)()",
                                 "orv.wait(0.01) repeat until false"};
    for (const char* loop : loops) {
        terminal.Type("x = x + 1 print('be' .. 'gun') " + std::string(loop) + "\r");
        terminal.WaitFor("begun\n");
        terminal.Type("\x03");
        EXPECT_TRUE(Contains(terminal.WaitFor("\n> "), "interrupted!")) << loop;
    }
    EXPECT_TRUE(Contains(terminal.Run("x"), "\n44\n"));
}

TEST_F(Prompt, EndsAScriptByForceAndStartsAfresh) {
    Terminal terminal(m_Home);
    terminal.WaitFor("> ");
    terminal.Run("jit.on() x = 1");
    // The interrupt may come before the loop is compiled.
    terminal.Type(
        "while true do pcall(function() print('be' .. 'gun') repeat until nil end) end\r");
    terminal.WaitFor("begun\n");
    terminal.Type("\x03");
    terminal.WaitFor("The script does not stop.");
    terminal.Type("\x03");
    EXPECT_TRUE(Contains(terminal.WaitFor("\n> "), "fresh state"));
    EXPECT_TRUE(Contains(terminal.Run("x, jit.status()"), "\nnil\tfalse"));
    terminal.Type("print('be' .. 'gun') repeat until nil\r");  // the new state can be stopped
    terminal.WaitFor("begun\n");
    terminal.Type("\x03");
    EXPECT_TRUE(Contains(terminal.WaitFor("\n> "), "interrupted!"));
    terminal.Type("\x04");
    EXPECT_EQ(terminal.Wait(), 0);
}

TEST_F(Prompt, KeepsAHistory) {
    {
        Terminal terminal(m_Home);
        terminal.WaitFor("> ");
        terminal.Run("'first' .. ' one'");
        terminal.Type("\x04");
        EXPECT_EQ(terminal.Wait(), 0);
    }
    struct stat folder = {};
    EXPECT_EQ(stat(m_Home.Path("a/b/oxscript").c_str(), &folder), 0);
    EXPECT_EQ(folder.st_mode & 0777, 0700u);
    std::ifstream file(m_Home.Path("a/b/oxscript/history"));
    std::stringstream content;
    content << file.rdbuf();
    EXPECT_TRUE(Contains(content.str(), "first")) << content.str();

    Terminal terminal(m_Home);
    terminal.WaitFor("> ");
    EXPECT_TRUE(Contains(terminal.Run("\x10"), "\nfirst one\n"));  // the line before
}

}  // namespace
}  // namespace Korvel
