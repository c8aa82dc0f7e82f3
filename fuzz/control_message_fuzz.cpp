// Random control messages (but those starting a run) through handle_client_message;
// each reply and the configuration file checked against a model of the rules.
#include <string.h>
#include <sys/socket.h>

#include <fstream>

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
std::string values[CONFIG_ITEM_COUNT];  // the model's configuration file
LogController controller;
int pair[2];

std::string message(Fuzz& f) {
    static const char kBytes[] = "a=_ \n\r\t\0/.x\xff";
    std::string key = f.pick(4) ? KEYS[f.pick(CONFIG_ITEM_COUNT)] : f.text(12, kBytes, 13);
    if (f.pick(6) == 0) key = (f.pick(2) ? "sublog_" : "sublog") + key;
    std::string value;
    switch (f.pick(5)) {
        case 0: value = std::to_string(static_cast<long>(f.rng() % 2000) - 10); break;
        case 1: value = PATHS[f.pick(sizeof(PATHS) / sizeof(PATHS[0]))]; break;
        case 2: value = "/" + std::string(85 + f.pick(12), 'p'); break;
        default: value = f.text(20, kBytes, 13); break;
    }
    std::string m = std::string(f.pick(3), ' ') + key + (f.pick(8) ? "=" : "") + value + std::string(f.pick(3), ' ');
    if (f.pick(10) == 0) m = (f.pick(2) ? "stop" : "deep_stop") + f.text(6, kBytes, 13);
    if (f.pick(8) == 0) m = f.text(250, kBytes, 13);
    if (f.pick(4)) m += f.pick(2) ? '\0' : '\n';  // else the last byte is taken for the terminator
    return m.substr(0, CONTROL_MSG_MAX);
}

// The reply suffix the rules give, and the item the message stores (-1: none).
const char* expect(const std::string& text, bool inner_nul, int* item, std::string* value) {
    *item = -1;
    if (inner_nul) return REPLY_FAILED;
    std::string m = fuzz_skip_spaces(fuzz_trimmed(text));
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

const char* one_round(Fuzz& f) {
    if (f.round == 0) {
        controller.boot_mode = 1;  // no exception-engine tool
        ConfigCache cache;
        config_init(&cache);
        config_write(&cache);
        for (int i = 0; i < CONFIG_ITEM_COUNT; i++) values[i] = cache.items[i].value;
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return "no socket pair";
    }
    f.input = message(f);
    if (f.input.empty()) return nullptr;
    std::string text = f.input.substr(0, f.input.size() - 1);
    std::string upto_nul = text.substr(0, text.find('\0'));
    int command = match_control_command(upto_nul.c_str());
    if (command != CONTROL_CONFIG && command != CONTROL_STOP && command != CONTROL_DEEP_STOP) return nullptr;
    if (write(pair[1], f.input.data(), f.input.size()) != static_cast<ssize_t>(f.input.size())) return "cannot send";
    if (handle_client_message(&controller, pair[0]) != 1) return "client dropped";
    char reply[CONTROL_REPLY_MAX + 64];
    ssize_t n = recv(pair[1], reply, sizeof(reply), MSG_DONTWAIT);
    std::string got = n > 0 ? std::string(reply, static_cast<size_t>(n)) : "";

    std::string want, value;
    int item = -1;
    if (command == CONTROL_CONFIG) {
        want = fuzz_trimmed(upto_nul) + expect(upto_nul, upto_nul.size() < text.size(), &item, &value);
    } else {
        want = command == CONTROL_STOP ? "stop,1" : "deep_stop,1";
        if (command == CONTROL_DEEP_STOP) item = 0, value = "0";
    }
    // A change rewrites the file from what was read back, which the
    // reader trims; an equal value leaves the file alone.
    if (item >= 0 && fuzz_trimmed(fuzz_skip_spaces(values[item])) != value) {
        for (std::string& v : values) v = fuzz_trimmed(fuzz_skip_spaces(v));
        values[item] = value;
    }
    if (got != want) return "reply differs from the model";
    std::string file;
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) file += std::string(KEYS[i]) + "=" + values[i] + "\n";
    std::ifstream in(CONFIG_FILE);
    return std::string(std::istreambuf_iterator<char>(in), {}) == file ? nullptr : "configuration file differs from the model";
}

}  // namespace

int main(int argc, char** argv) { return fuzz_main("control_message_fuzz", argc, argv, 0x7a7102, 3000, one_round); }
