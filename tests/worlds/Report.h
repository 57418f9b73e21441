#pragma once

#include "Model.h"

#include <mutex>
#include <string>
#include <string_view>

namespace rolvane::worlds {

// What a process of a world tells the one that started it: lines on a pipe, a letter and fields with tabs between. A
// line is written whole or not at all, and stays when the process is killed. Two processes may share the pipe; but for
// views, lines come in the order in which they were written. Any thread.
class Report {
public:
    // `whose`: begins each line.
    explicit Report(int descriptor, std::string whose = {}) : _descriptor(descriptor), _whose(std::move(whose)) {}

    void line(char kind, std::string_view text = {});
    void deed(const Deed& deed);
    void view(const View& view);

    // While one lives the process is not killed by itself: an edit and the line that tells it stay together.
    std::recursive_mutex& whole() { return _whole; }
    // Ends the process as SIGKILL does; returns when an edit is under way.
    void die(std::string_view where);

private:
    void send(const std::string& lines);
    const int _descriptor;
    const std::string _whose;
    std::mutex _mutex;
    std::recursive_mutex _whole;
};

namespace lines {
inline constexpr char kDeed = 'D';
inline constexpr char kKilled = 'K';   // where
inline constexpr char kFault = 'F';    // kind, request
inline constexpr char kRefused = 'R';  // a write of the writer's was answered with 403
inline constexpr char kDiskFull = 'S'; // a write to a file of the daemon failed
inline constexpr char kSettled = 'P';  // a pass has ended and nothing waits
inline constexpr char kWrote = 'W';    // method and path of a request that changes the store
inline constexpr char kThrew = 'X';    // an exception left a pass
inline constexpr char kWrong = 'E';    // something that must not be
inline constexpr char kPerson = 'p', kGroup = 'g', kCell = 'c', kWhole = 'w';
} // namespace lines

// The fields of a line without its first letter; taken back into the model's forms.
std::vector<std::string> fieldsOf(std::string_view line);
Deed deedOf(const std::vector<std::string>& fields);
void readViewLine(char kind, const std::vector<std::string>& fields, View& into);

} // namespace rolvane::worlds
