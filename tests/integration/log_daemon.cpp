#include "tests/integration/log_daemon.h"

#include <ctype.h>
#include <dirent.h>
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>

static const char kNewClient[] = "new client,fd:";

bool contains(const std::string& text, const std::string& needle) {
    return text.find(needle) != std::string::npos;
}

int count(const std::string& text, const std::string& needle) {
    int n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) n++;
    return n;
}

int ctl(EmuPhone& phone, const std::vector<std::string>& args, std::string* out) {
    std::vector<std::string> command = {"tavlologctl"};
    command.insert(command.end(), args.begin(), args.end());
    return phone.exec(command, out);
}

bool configure(EmuPhone& phone, const std::vector<std::string>& settings) {
    // One shell for all of them: each exec into the phone costs a fraction of a second.
    std::string script = "set -e";
    for (const std::string& s : settings) script += "; tavlologctl '" + s + "'";
    std::string out;
    if (phone.exec({"sh", "-c", script}, &out) != 0) return false;
    std::string expected;
    for (const std::string& s : settings) expected += s + ",1\n";
    return out == expected;
}

std::string history(const EmuPhone& phone) { return phone.read_file(kHistory); }

int daemon_starts(const EmuPhone& phone) {
    return count(phone.read_file("/dev/emu/init.log"), "start tavlo_log_d pid ");
}

std::string platform_log(const EmuPhone& phone) { return phone.read_file("/dev/emu/wlog"); }

std::vector<std::string> after_each(const std::string& text, const std::string& needle) {
    std::vector<std::string> found;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) {
        size_t from = at + needle.size();
        size_t end = text.find('\n', from);
        found.push_back(text.substr(from, end == std::string::npos ? std::string::npos : end - from));
    }
    return found;
}

bool wait_history(const EmuPhone& phone, const std::string& needle, int times, int timeout_ms) {
    return EmuPhone::wait_for([&] { return count(history(phone), needle) >= times; }, timeout_ms);
}

std::string history_since_last(const EmuPhone& phone, const std::string& needle) {
    std::string text = history(phone);
    size_t at = text.rfind(needle);
    return at == std::string::npos ? std::string() : text.substr(at + needle.size());
}

std::vector<std::string> recorded_values(const EmuPhone& phone, const std::string& record,
                                         bool* same) {
    // The platform log first: each record goes to the history before it.
    std::vector<std::string> logged = after_each(platform_log(phone), "TavloLogD: " + record);
    std::vector<std::string> values = after_each(history(phone), record);
    *same = !logged.empty() && logged.size() <= values.size() &&
            std::equal(logged.begin(), logged.end(), values.begin());
    return values;
}

bool collector_pids(const EmuPhone& phone, int pids[5]) {
    std::string text = history(phone);
    // The record is the only one that starts with "M(" after the time stamp.
    size_t at = text.rfind(" M(");
    if (at == std::string::npos) return false;
    return sscanf(text.c_str() + at, " M(%d),R(%d),E(%d),K(%d),B(%d)", &pids[0], &pids[1],
                  &pids[2], &pids[3], &pids[4]) == 5;
}

std::vector<std::string> run_folders(const EmuPhone& phone, const std::string& card) {
    std::vector<std::string> names;
    std::string root = phone.host_path(card + "/qrvlog/tavlolog");
    DIR* dir = root.empty() ? nullptr : opendir(root.c_str());
    if (dir == nullptr) return names;
    while (struct dirent* entry = (errno = 0, readdir(dir))) {
        if (std::string(entry->d_name).compare(0, 6, "APLog_") == 0) names.push_back(entry->d_name);
    }
    if (errno != 0) ADD_FAILURE() << "listing " << root << " failed: " << strerror(errno);
    closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

bool is_run_folder_name(const std::string& name) {
    // APLog_YYYY_MMDD_HHMMSS/
    static const char kShape[] = "APLog_dddd_dddd_dddddd/";
    if (name.size() != sizeof(kShape) - 1) return false;
    for (size_t i = 0; i < name.size(); i++) {
        if (kShape[i] == 'd' ? !isdigit(static_cast<unsigned char>(name[i])) : name[i] != kShape[i])
            return false;
    }
    int month = atoi(name.substr(11, 2).c_str());
    int day = atoi(name.substr(13, 2).c_str());
    int hour = atoi(name.substr(16, 2).c_str());
    int minute = atoi(name.substr(18, 2).c_str());
    int second = atoi(name.substr(20, 2).c_str());
    return month >= 1 && month <= 12 && day >= 1 && day <= 31 && hour < 24 && minute < 60 &&
           second < 61;
}

std::string run_folder(const EmuPhone& phone) { return phone.getprop("debug.TQ.realpath"); }

std::string body_of(const std::string& file, bool* ok) {
    bool has_header = file.compare(0, sizeof(kFileHeader) - 1, kFileHeader) == 0;
    if (ok != nullptr) *ok = has_header;
    return has_header ? file.substr(sizeof(kFileHeader) - 1) : std::string();
}

std::unique_ptr<EmuProcess> connect_listener(EmuPhone& phone, const std::string& send) {
    int clients = count(history(phone), kNewClient);
    std::vector<std::string> args = {"tavlologctl", "--listen"};
    if (!send.empty()) args.insert(args.end(), {"--send", send});
    std::unique_ptr<EmuProcess> listener = phone.spawn(args);
    if (!listener) return nullptr;
    // With a command, its reply line proves the connection; without one, the
    // daemon's record of the new client does.
    bool ready = send.empty() ? wait_history(phone, kNewClient, clients + 1)
                              : listener->read_until("\n", 10000);
    return ready ? std::move(listener) : nullptr;
}

std::string numbered_lines(const std::string& tag, int first, int n, int length) {
    std::string text;
    text.reserve(static_cast<size_t>(n) * static_cast<size_t>(length));
    char line[256];
    if (length < 24) length = 24;
    if (length > static_cast<int>(sizeof(line)) - 1) length = sizeof(line) - 1;
    for (int i = first; i < first + n; i++) {
        int used = snprintf(line, sizeof(line), "%s line %07d ", tag.c_str(), i);
        if (used > length - 1) used = length - 1;
        for (int j = used; j < length - 1; j++) line[j] = static_cast<char>('a' + (i + j) % 26);
        line[length - 1] = '\n';
        text.append(line, static_cast<size_t>(length));
    }
    return text;
}

// A few bytes around offset, control bytes escaped.
static std::string excerpt(const std::string& text, size_t offset) {
    size_t from = offset > 24 ? offset - 24 : 0;
    std::string shown;
    for (size_t i = from; i < text.size() && i < offset + 40; i++) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        if (c >= 0x20 && c < 0x7f) {
            shown += static_cast<char>(c);
        } else {
            char esc[8];
            snprintf(esc, sizeof(esc), "\\x%02x", c);
            shown += esc;
        }
    }
    return "\"" + shown + "\"";
}

::testing::AssertionResult same_bytes(const std::string& actual, const std::string& expected) {
    size_t n = std::min(actual.size(), expected.size());
    size_t at = 0;
    while (at < n && actual[at] == expected[at]) at++;
    if (at == n && actual.size() == expected.size()) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure()
           << actual.size() << " bytes where " << expected.size()
           << " were expected; first difference at offset " << at << ": got "
           << excerpt(actual, at) << ", expected " << excerpt(expected, at);
}

bool is_prefix(const std::string& part, const std::string& whole) {
    return part.size() <= whole.size() && whole.compare(0, part.size(), part) == 0;
}

bool is_suffix(const std::string& part, const std::string& whole) {
    return part.size() <= whole.size() &&
           whole.compare(whole.size() - part.size(), part.size(), part) == 0;
}
