#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace tamber::testing {

// The built `tamber` program run as a child process with its own environment, for what only
// separate processes show (locks held by another process, messages printed by whole runs).
class TamberProcess {
public:
    // Starts `tamber args...` with the test's environment plus `environment` (which wins).
    TamberProcess(const std::vector<std::string>& args,
                  const std::map<std::string, std::string>& environment);
    ~TamberProcess();  // kills a child that is still running
    TamberProcess(const TamberProcess&) = delete;
    TamberProcess& operator=(const TamberProcess&) = delete;

    pid_t pid() const { return pid_; }
    // Reads the child's output until standard error contains `text` or the child closes it;
    // false when it never did. Gives up (false) after `seconds`.
    bool waitForError(const std::string& text, int seconds = 30);
    // The same for standard output.
    bool waitForOutput(const std::string& text, int seconds = 30);
    // Sends `signal` to a child still running.
    void sendSignal(int signal);
    // Reads everything until the child exits and returns its exit status (-1 when it had to
    // be killed after `seconds`, or did not exit normally).
    int finish(int seconds = 60);
    // After finish(): the signal that ended the child (0 when it exited), and whether finish()
    // had to kill it because it did not end in time.
    int termSignal() const { return termSignal_; }
    bool timedOut() const { return timedOut_; }

    const std::string& out() const { return out_; }
    const std::string& err() const { return err_; }

    // Reads what is available for up to `timeoutMs`; false once both pipes are closed.
    bool pump(int timeoutMs);

private:
    pid_t pid_ = -1;
    int outFd_ = -1;
    int errFd_ = -1;
    std::string out_;
    std::string err_;
    int termSignal_ = 0;
    bool timedOut_ = false;
};

// How many times `needle` occurs in `text`.
size_t occurrences(const std::string& text, const std::string& needle);

}  // namespace tamber::testing
