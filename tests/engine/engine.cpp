// A scripting engine for tests. It plays the moves that the script (its second argument) lists, one on a line:
//
//   send COMMAND FIRST [SECOND]   writes one message; FIRST is one word, SECOND the rest of the line
//   raw HEX                       writes these bytes with one write
//   flood COUNT SIZE              writes COUNT messages of SIZE bytes (command 99, empty texts) and reads no answer
//   exitmsg                       writes EXIT
//   answer                        reads one answer
//   expect STATUS [TEXT]          reads one answer, which must be this one
//   read COUNT | read length      reads that many bytes of the input; "length": what the seventh argument says
//   write-output TEXT             appends to the output file (fourth argument)
//   write-answer, write-body      appends "STATUS TEXT" of the last answer and a line end; what was read last
//   status                        appends a report on the engine's own process (see moves.h)
//   replace-output TEXT           puts a new file in the place of the output file
//   touch PATH, wait-file PATH    makes a file; waits until there is one
//   log TEXT                      writes a line to standard error
//   close NUMBER                  closes a descriptor
//   wait-read                     waits until all that was written has been read: the next write is a message of its
//   own ignore SIGNAL                 ignores a signal (by number) catch SIGNAL, wait-signal     survives a signal;
//   waits until a caught one has come sleep SECONDS, forever        waits; a signal with a handler does not shorten it
//   fork-sleep SECONDS            leaves a child behind that keeps the pipes open; "child PID" in the output file
//   exit CODE, kill SIGNAL        ends at once
//   repeat COUNT ... end          plays the lines between them COUNT times; not nested
//
// In texts \n, \t, \\ and \xHH stand for characters, "-" alone for the empty text, %a for the text of the last answer,
// %n for the number of the repetition (from 0), %1 to %8 for an argument. Empty lines and lines that begin with # are
// passed over. After the last move, and without a script, the engine ends with code 0. A move that fails (an answer
// that is not the expected one, too little input) says so on standard error and ends it with code 90.
#include <sys/ioctl.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "moves.h"

namespace {

constexpr std::size_t SCRIPT_ARGUMENT = 2;
constexpr std::size_t OUTPUT_ARGUMENT = 4;
constexpr double LOOK_AGAIN = 0.002;  // seconds between two looks at what is waited for

volatile std::sig_atomic_t caught = 0;

// Takes the first word off the text.
std::string TakeWord(std::string& text) {
    const std::size_t end = text.find(' ');
    std::string word = text.substr(0, end);
    text.erase(0, end == std::string::npos ? end : end + 1);
    return word;
}

std::string FromHex(const std::string& hex) {
    std::string bytes;
    for (std::size_t i = 0; i + 1 < hex.size(); i += 2)
        bytes += static_cast<char>(std::strtol(hex.substr(i, 2).c_str(), nullptr, 16));
    return bytes;
}

class Player {
public:
    explicit Player(const std::vector<std::string>& arguments) : m_moves(arguments) {}

    void Play(const std::vector<std::string>& lines) {
        for (std::size_t i = 0; i < lines.size(); ++i) {
            std::string rest = lines[i];
            if (TakeWord(rest) != "repeat") {
                PlayLine(lines[i]);
                continue;
            }
            std::size_t end = i + 1;
            while (end < lines.size() && lines[end] != "end")
                ++end;
            const unsigned long count = std::strtoul(rest.c_str(), nullptr, 10);
            for (m_repetition = 0; m_repetition < count; ++m_repetition)
                for (std::size_t line = i + 1; line < end; ++line)
                    PlayLine(lines[line]);
            i = end;
        }
    }

private:
    std::string Expand(const std::string& text) const {
        if (text == "-")
            return {};
        std::string result;
        for (std::size_t i = 0; i < text.size(); ++i) {
            const char next = i + 1 < text.size() ? text[i + 1] : '\0';
            if (text[i] == '\\' && next == 'x') {
                result += FromHex(text.substr(i + 2, 2));
                i += 3;
            } else if (text[i] == '\\' && next != '\0') {
                result += next == 'n' ? '\n' : next == 't' ? '\t' : next;
                ++i;
            } else if (text[i] == '%' && (next == 'a' || next == 'n' || (next >= '1' && next <= '8'))) {
                result += next == 'a'   ? m_answer.text
                          : next == 'n' ? std::to_string(m_repetition)
                                        : m_moves.Argument(static_cast<std::size_t>(next - '0'));
                ++i;
            } else {
                result += text[i];
            }
        }
        return result;
    }

    void PlayLine(const std::string& line) {
        std::string rest = line;
        const std::string move = TakeWord(rest);
        if (!move.empty() && move[0] != '#' && !Talk(move, rest) && !Write(move, rest) && !Behave(move, rest))
            Fail("there is no move " + line);
    }

    bool Talk(const std::string& move, std::string rest) {
        if (move == "send") {
            const int command = std::atoi(TakeWord(rest).c_str());
            const std::string first = Expand(TakeWord(rest));
            m_moves.Send(command, first, Expand(rest));
        } else if (move == "raw") {
            m_moves.Raw(FromHex(rest));
        } else if (move == "flood") {
            const unsigned long count = std::strtoul(TakeWord(rest).c_str(), nullptr, 10);
            m_moves.Flood(count, std::strtoul(rest.c_str(), nullptr, 10));
        } else if (move == "exitmsg") {
            m_moves.Raw("EXIT");
        } else if (move == "answer") {
            m_answer = m_moves.ReadAnswer();
        } else if (move == "expect") {
            const int status = std::atoi(TakeWord(rest).c_str());
            const std::string text = Expand(rest);
            m_answer = m_moves.ReadAnswer();
            if (m_answer.status != status || m_answer.text != text)
                Fail("expected " + std::to_string(status) + " \"" + text + "\", got " +
                     std::to_string(m_answer.status) + " \"" + m_answer.text + "\"");
        } else if (move == "read") {
            m_body = m_moves.ReadInput(rest == "length" ? m_moves.AnnouncedLength()
                                                        : std::strtoul(rest.c_str(), nullptr, 10));
        } else {
            return false;
        }
        return true;
    }

    bool Write(const std::string& move, const std::string& rest) {
        if (move == "write-output")
            m_moves.WriteOutput(Expand(rest));
        else if (move == "write-answer")
            m_moves.WriteOutput(std::to_string(m_answer.status) + " " + m_answer.text + "\n");
        else if (move == "write-body")
            m_moves.WriteOutput(m_body);
        else if (move == "status")
            m_moves.WriteOutput(m_moves.Status());
        else if (move == "replace-output")
            Replace(m_moves.Argument(OUTPUT_ARGUMENT), Expand(rest));
        else if (move == "touch")
            Replace(Expand(rest), "");
        else if (move == "log")
            std::fprintf(stderr, "%s\n", Expand(rest).c_str());
        else
            return false;
        return true;
    }

    bool Behave(const std::string& move, const std::string& rest) {
        if (move == "wait-file")
            WaitFor([path = Expand(rest)] { return access(path.c_str(), F_OK) == 0; });
        else if (move == "close")
            close(std::atoi(rest.c_str()));
        else if (move == "ignore")
            std::signal(std::atoi(rest.c_str()), SIG_IGN);
        else if (move == "catch")
            std::signal(std::atoi(rest.c_str()), [](int) { caught = 1; });
        else if (move == "wait-signal")
            WaitFor([] { return caught != 0; });
        else if (move == "wait-read")
            WaitFor([] {
                int left = 0;
                return ioctl(STDOUT_FILENO, FIONREAD, &left) != 0 || left == 0;
            });
        else if (move == "sleep")
            SleepFor(std::strtod(rest.c_str(), nullptr));
        else if (move == "forever")
            for (;;)
                pause();
        else if (move == "fork-sleep")
            m_moves.ForkSleep(std::strtod(rest.c_str(), nullptr));
        else if (move == "exit")
            _exit(std::atoi(rest.c_str()));
        else if (move == "kill")
            Kill(std::atoi(rest.c_str()));
        else
            return false;
        return true;
    }

    static void Replace(const std::string& path, const std::string& text) {
        const std::string fresh = path + ".new";
        std::ofstream(fresh, std::ios::binary) << text;
        if (std::rename(fresh.c_str(), path.c_str()) != 0)
            Fail("cannot make " + path);
    }
    template <typename Condition>
    static void WaitFor(Condition holds) {
        while (!holds())
            SleepFor(LOOK_AGAIN);
    }
    static void Kill(int signal) {
        kill(getpid(), signal);
        for (;;)
            pause();
    }

    Moves m_moves;
    Answer m_answer;
    std::string m_body;
    unsigned long m_repetition = 0;
};

}  // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> arguments(argv, argv + argc);
    if (arguments.size() <= SCRIPT_ARGUMENT || arguments[SCRIPT_ARGUMENT] == "NULL")
        return 0;
    std::vector<std::string> lines;
    {
        std::ifstream script(arguments[SCRIPT_ARGUMENT]);
        if (!script)
            Fail("cannot read " + arguments[SCRIPT_ARGUMENT]);
        for (std::string line; std::getline(script, line);)
            lines.push_back(line);
    }
    Player(arguments).Play(lines);
    return 0;
}
