// Randomized harness for the control socket's command and configuration-message
// handling: random, structured and mutated messages go through
// handle_client_message on a socket pair; each reply and the configuration
// file are checked against a small model of the protocol's rules.
//
//   control_message_fuzz [SECONDS [SEED]]   (or TAVLO_FUZZ_SECONDS, TAVLO_FUZZ_SEED)
//
// Runs inside the emulated phone only: it writes /data. Commands that start a
// run are not sent (their handling is the run's, not the parser's).
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <random>
#include <string>

#include "common/control_protocol.h"
#include "config/config_store.h"
#include "config/log_path.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "fuzz/fuzz_util.h"

namespace {

const char* const KEYS[CONFIG_ITEM_COUNT] = {"autostart", "logpath",  "logsize", "AndroidLog",
                                             "KernelLog", "BTLog", "totallogsize"};
const char* const PATHS[] = {"internal_sd", "external_sd", "/data", "tmp", "/mnt/sdcard/../../data",
                             "/a/./b", "/mnt/sdcard2/logs/", "..", "/"};
std::mt19937_64 rng;
unsigned long seed = 0x7a7102, iteration = 0;

size_t pick(size_t n) { return static_cast<size_t>(rng() % n); }

[[noreturn]] void fail(const char* what, const std::string& input, const std::string& detail) {
    fprintf(stderr, "control_message_fuzz: FAILED at iteration %lu (seed %lu): %s\ninput: \"%s\"\n%s\n",
            iteration, seed, what, fuzz_printable(input).c_str(), fuzz_printable(detail).c_str());
    abort();
}

std::string bytes(size_t max) {
    std::string s(pick(max + 1), '\0');
    for (char& c : s) c = "a=_ \n\r\t\0/.x\xff"[pick(13)];
    return s;
}

std::string message() {
    std::string key = pick(4) ? KEYS[pick(CONFIG_ITEM_COUNT)] : bytes(12);
    if (pick(6) == 0) key = (pick(2) ? "sublog_" : "sublog") + key;
    std::string value;
    switch (pick(5)) {
        case 0: value = std::to_string(static_cast<long>(rng() % 2000) - 10); break;
        case 1: value = PATHS[pick(sizeof(PATHS) / sizeof(PATHS[0]))]; break;
        case 2: value = "/" + std::string(85 + pick(12), 'p'); break;
        default: value = bytes(20); break;
    }
    std::string m = std::string(pick(3), ' ') + key + (pick(8) ? "=" : "") + value + std::string(pick(3), ' ');
    if (pick(10) == 0) m = (pick(2) ? "stop" : "deep_stop") + bytes(6);
    if (pick(8) == 0) m = bytes(250);
    if (pick(4)) m += pick(2) ? '\0' : '\n';  // else the last byte is taken for the terminator
    return m.substr(0, CONTROL_MSG_MAX);
}

std::string trimmed(std::string s) {
    while (s.size() > 1 && (s.back() == ' ' || s.back() == '\n')) s.pop_back();
    return s;
}

std::string skip_spaces(const std::string& s) {
    size_t lead = s.find_first_not_of(' ');
    return lead == std::string::npos ? "" : s.substr(lead);
}

// The reply suffix the rules give, and the item the message stores (-1: none).
const char* expect(const std::string& text, bool inner_nul, int* item, std::string* value) {
    *item = -1;
    if (inner_nul) return REPLY_FAILED;
    std::string m = skip_spaces(trimmed(text));
    size_t eq = m.find('=');
    if (eq == std::string::npos) return REPLY_DONE;
    std::string key = m.substr(0, eq);
    *value = m.substr(eq + 1);
    if (key.find("sublog") != std::string::npos) {
        if (key.find('_') == std::string::npos) return REPLY_DONE;
        key = key.substr(key.find('_') + 1);
    }
    if (key.find('\n') != std::string::npos || value->find('\n') != std::string::npos || value->empty())
        return REPLY_FAILED;
    if (key.size() >= CONFIG_FIELD_LEN || value->size() >= CONFIG_FIELD_LEN || key.size() + value->size() > 97)
        return REPLY_FAILED;
    if (key == "logpath" && !log_path_value_valid(value->c_str())) return REPLY_FAILED;
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++)
        if (key == KEYS[i]) *item = i;
    return REPLY_DONE;
}

std::string read_all(const char* path) {
    std::string out;
    FILE* f = fopen(path, "r");
    for (int c; f && (c = fgetc(f)) != EOF;) out += static_cast<char>(c);
    if (f) fclose(f);
    return out;
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = 10.0;
    fuzz_start("control_message_fuzz", argc, argv, &seconds, &seed);
    rng.seed(seed);

    LogController controller;
    controller.boot_mode = 1;  // no exception-engine tool
    ConfigCache cache;
    config_init(&cache);
    config_write(&cache);
    std::string values[CONFIG_ITEM_COUNT];
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) values[i] = cache.items[i].value;
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return 2;

    for (double deadline = fuzz_now() + seconds; fuzz_now() < deadline; iteration++) {
        std::string sent = message();
        if (sent.empty()) continue;
        std::string text = sent.substr(0, sent.size() - 1);
        std::string upto_nul = text.substr(0, text.find('\0'));
        int command = match_control_command(upto_nul.c_str());
        if (command != CONTROL_CONFIG && command != CONTROL_STOP && command != CONTROL_DEEP_STOP) continue;
        if (write(pair[1], sent.data(), sent.size()) != static_cast<ssize_t>(sent.size())) return 2;
        if (handle_client_message(&controller, pair[0]) != 1) fail("client dropped", sent, "");
        char reply[CONTROL_REPLY_MAX + 64];
        ssize_t n = recv(pair[1], reply, sizeof(reply), MSG_DONTWAIT);
        std::string got = n > 0 ? std::string(reply, static_cast<size_t>(n)) : "";

        std::string want, value;
        int item = -1;
        if (command == CONTROL_CONFIG) {
            want = trimmed(upto_nul) + expect(upto_nul, upto_nul.size() < text.size(), &item, &value);
        } else {
            want = command == CONTROL_STOP ? "stop,1" : "deep_stop,1";
            if (command == CONTROL_DEEP_STOP) item = 0, value = "0";
        }
        // A change rewrites the file from what was read back, which the
        // reader trims; an equal value leaves the file alone.
        if (item >= 0 && trimmed(skip_spaces(values[item])) != value) {
            for (std::string& v : values) v = trimmed(skip_spaces(v));
            values[item] = value;
        }
        if (got != want) fail("reply differs from the model", sent, "got " + got + "\nwant " + want);
        std::string file;
        for (int i = 0; i < CONFIG_ITEM_COUNT; i++) file += std::string(KEYS[i]) + "=" + values[i] + "\n";
        if (read_all(CONFIG_FILE) != file) fail("configuration file differs from the model", sent, read_all(CONFIG_FILE));
    }
    printf("control_message_fuzz: %lu messages, no failure\n", iteration);
    return 0;
}
