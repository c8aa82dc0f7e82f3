// The text commands of the control socket: start, deep_start, stop,
// deep_stop, copy, HBR_SHUTDOWN and key=value configuration changes.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "common/control_protocol.h"
#include "common/io_util.h"
#include "common/wlog.h"
#include "config/config_store.h"
#include "config/log_path.h"
#include "core/boot_copy.h"
#include "core/client_table.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "platform/properties.h"
#include "storage/debug_dump.h"
#include "storage/history_log.h"
#include "transist/transist.h"

// Size in MB of the run that carries logging through a fast power-off.
static constexpr int HBR_LOG_MB = 60;

// Room for a whole message with every byte written as "\xNN".
static constexpr int PRINTABLE_MAX = CONTROL_MSG_MAX * 4 + 1;

// Copies text for a record, control bytes written as "\xNN": a client's bytes
// must not break the one-record-per-line history or the terminal reading it.
static const char* printable(const char* text, char* out, size_t n) {
    size_t used = 0;
    for (const unsigned char* p = reinterpret_cast<const unsigned char*>(text); *p; p++) {
        if (*p >= 0x20 && *p != 0x7f) {
            if (used + 2 > n) break;
            out[used++] = static_cast<char>(*p);
        } else {
            if (used + 5 > n) break;
            used += snprintf(out + used, n - used, "\\x%02x", *p);
        }
    }
    out[used] = '\0';
    return out;
}

static void reply_word(LogController* controller, int fd, const char* word, const char* suffix) {
    char reply[CONTROL_REPLY_MAX + 1];
    snprintf(reply, sizeof(reply), "%s%s", word, suffix);
    reply_client(controller, fd, reply);
}

// Reads logpath and logsize from the configuration file into the controller.
static void load_path_and_size(LogController* controller) {
    ConfigCache cache;
    config_init(&cache);
    config_load(&cache);
    const char* value;
    if ((value = config_get(&cache, "logpath"))) {
        copy_str(controller->logpath, sizeof(controller->logpath), value);
    }
    if ((value = config_get(&cache, "logsize"))) controller->logsize = logsize_from(value);
}

// Loads the options and names and creates the run folder. Returns 1, or 0
// when the folder cannot be created or the collectors could not be served.
static int prepare_run(LogController* controller) {
    // A run whose collectors cannot reach the transist records nothing.
    if (!transist_listen()) {
        HLOG(TAG_MAIN, WLOG_ERROR, "log_socket cannot be served, no run started");
        return 0;
    }
    ConfigCache cache;
    config_init(&cache);
    config_load(&cache);
    controller->load_boot_options(cache);
    compose_run_folder(controller);
    return create_run_folder(controller, controller->logpath, controller->run_folder) > 0;
}

// Starts a run in the folder prepare_run made.
static void launch_run(LogController* controller) {
    publish_run_folder(controller, controller->run_folder);
    controller->rotate_size_kb = calc_rotate_size(controller, controller->logsize);
    start_logging(controller);
}

static void dump_into_run_folder(LogController* controller) {
    run_debug_dump(controller->logpath, controller->run_folder);
}

static int start_by_command(LogController* controller, int fd, const char* word) {
    if (!prepare_run(controller)) {
        reply_word(controller, fd, word, REPLY_FAILED);
        return 0;
    }
    launch_run(controller);
    dump_into_run_folder(controller);
    return 1;
}

static int cmd_deep_start(LogController* controller, int fd) {
    if (run_live(controller)) {
        HLOG(TAG_MAIN, WLOG_INFO, "tqlog already running, why send deep_start");
        reply_word(controller, fd, CMD_DEEP_START, REPLY_DONE);
        return 1;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "'deep start' tavlolog");
    if (!start_by_command(controller, fd, CMD_DEEP_START)) return 0;
    reply_word(controller, fd, CMD_DEEP_START, REPLY_DONE);
    copy_saved_logs(controller);
    char autostart_on[] = "autostart=1";
    apply_config_message(controller, autostart_on);
    controller->log_path_state = 1;
    return 1;
}

static int cmd_start(LogController* controller, int fd) {
    if (run_live(controller)) {
        HLOG(TAG_MAIN, WLOG_INFO, "tqlog already running, why send start");
        reply_word(controller, fd, CMD_START, REPLY_DONE);
        return 1;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "start tavlolog");
    if (!start_by_command(controller, fd, CMD_START)) return 0;
    copy_saved_logs(controller);
    reply_word(controller, fd, CMD_START, REPLY_DONE);
    return 1;
}

// stop and deep_stop; deep_stop also keeps the next boot from logging.
static int cmd_stop(LogController* controller, int fd, bool deep) {
    if (controller->boot_mode == 0) oru_mode_off();
    stop_logging(controller);
    reply_word(controller, fd, deep ? CMD_DEEP_STOP : CMD_STOP, REPLY_DONE);
    if (deep) {
        char autostart_off[] = "autostart=0";
        apply_config_message(controller, autostart_off);
    }
    return 1;
}

// Moves the running run (held in /data) to a new folder under the log path.
static int move_run_to_log_path(LogController* controller, int fd) {
    // The collector choice of the running run stays: no load_boot_options here.
    load_path_and_size(controller);
    compose_run_folder(controller);
    if (create_run_folder(controller, controller->logpath, controller->run_folder) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir failed when copy");
        reply_word(controller, fd, CMD_COPY, REPLY_FAILED);
        return 0;
    }
    controller->rotate_size_kb = calc_rotate_size(controller, controller->logsize);
    switch_run_folder(controller, controller->run_folder);
    controller->log_path_state = 1;
    reply_word(controller, fd, CMD_COPY, REPLY_DONE);
    copy_saved_logs(controller);
    dump_into_run_folder(controller);
    return 1;
}

static int cmd_copy(LogController* controller, int fd) {
    if (run_live(controller)) {
        if (controller->log_path_state == 1) {
            HLOG(TAG_MAIN, WLOG_ERROR, "has copyed to sd,ignore this 'copy'");
            reply_word(controller, fd, CMD_COPY, REPLY_DONE);
            return 1;
        }
        HLOG(TAG_MAIN, WLOG_INFO, "copy to sdcard!");
        return move_run_to_log_path(controller, fd);
    }
    HLOG(TAG_MAIN, WLOG_INFO, "start tavlolog when recv copy");
    // The client learns as soon as the folder exists; the run starts after the reply.
    if (!prepare_run(controller)) {
        reply_word(controller, fd, CMD_COPY, REPLY_FAILED);
        return 0;
    }
    reply_word(controller, fd, CMD_COPY, REPLY_DONE);
    launch_run(controller);
    copy_saved_logs(controller);
    dump_into_run_folder(controller);
    return 1;
}

// Fast power-off: keep logging into /data, where the logs survive the
// power-off, unless logging at boot is off anyway.
static int cmd_hbr_shutdown(LogController* controller, int fd) {
    {
        ConfigCache cache;
        config_init(&cache);
        config_load(&cache);
        const char* value = config_get(&cache, "autostart");
        if (value) controller->autostart = atoi(value);
    }
    if (controller->autostart == 0) {
        HLOG(TAG_MAIN, WLOG_INFO, "as boot option is 0, stop tavlolog for hbrshutdown");
        stop_logging(controller);
        reply_word(controller, fd, CMD_HBR_SHUTDOWN, REPLY_DONE);
        return 1;
    }
    if (create_run_folder(controller, "/data", HBR_FOLDER) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir fail when hbr_shutdown!");
        HLOG(TAG_MAIN, WLOG_ERROR, "create %s failed when hbr_shutdown!", HBR_FOLDER);
        reply_word(controller, fd, CMD_HBR_SHUTDOWN, REPLY_FAILED);
        return 0;
    }
    controller->log_path_state = 0;
    controller->rotate_size_kb = calc_rotate_size(controller, HBR_LOG_MB);
    switch_run_folder(controller, HBR_FOLDER);
    reply_word(controller, fd, CMD_HBR_SHUTDOWN, REPLY_DONE);
    // The phone is going down: nobody is to send further commands.
    close_all_clients(controller);
    return 1;
}

int handle_client_message(LogController* controller, int fd) {
    // One spare byte so that the text is terminated even when the read is full.
    char message[CONTROL_MSG_MAX + 1] = {};
    ssize_t n = RETRY_EINTR(read(fd, message, CONTROL_MSG_MAX));
    if (n < 0) {
        // Nothing there after all (the socket is non-blocking): keep the client.
        if (errno == EAGAIN || errno == EWOULDBLOCK) return 1;
        HLOG(TAG_MAIN, WLOG_ERROR, "read socket from client %d fail(%s)", fd, strerror(errno));
        return 0;
    }
    if (n == 0) {
        WLOG(TAG_MAIN, WLOG_DEBUG, "receive an empty message from client %d", fd);
        return 0;
    }
    // The last byte is the command's terminator. The text is taken up to its
    // first NUL; a command word ignores what follows it anyway.
    message[n - 1] = '\0';
    bool inner_nul = strlen(message) < static_cast<size_t>(n - 1);
    char shown[PRINTABLE_MAX];
    HLOG(TAG_MAIN, WLOG_INFO, "recv '%s' from client %d", printable(message, shown, sizeof(shown)),
         fd);

    switch (match_control_command(message)) {
        case CONTROL_DEEP_START:
            return cmd_deep_start(controller, fd);
        case CONTROL_START:
            return cmd_start(controller, fd);
        case CONTROL_DEEP_STOP:
            return cmd_stop(controller, fd, true);
        case CONTROL_STOP:
            return cmd_stop(controller, fd, false);
        case CONTROL_COPY:
            return cmd_copy(controller, fd);
        case CONTROL_HBR_SHUTDOWN:
            return cmd_hbr_shutdown(controller, fd);
        default:
            break;
    }
    // Configuration messages are answered with their trimmed text (leading
    // spaces kept) and ",1", or ",0" when the value was refused as unsafe to
    // store; a message that is no setting at all is only recorded.
    int stored;
    if (inner_nul) {
        // What follows the NUL would be stored or lost unseen.
        trim(message);
        HLOG(TAG_MAIN, WLOG_ERROR, "%s is not a valid configure (NUL byte)",
             printable(message, shown, sizeof(shown)));
        stored = 0;
    } else {
        stored = apply_config_message(controller, message);
    }
    reply_word(controller, fd, message, stored ? REPLY_DONE : REPLY_FAILED);
    return 1;
}

// Why a configuration text cannot be stored, or nullptr when it can.
static const char* config_fault(const char* key, const char* value) {
    // A line feed would add a line of its own to the configuration file;
    // other bytes (a trailing "\r", a tab) are stored as they come.
    if (strchr(key, '\n') != nullptr || strchr(value, '\n') != nullptr) return "line feed";
    // Stored empty, a value reads back from the file as a lone line feed,
    // which the next rewrite turns into a line of its own.
    if (value[0] == '\0') return "empty value";
    // Items hold at most CONFIG_FIELD_LEN - 1 characters and a stored line
    // "key=value\n" at most 99: a longer value would be stored cut.
    size_t key_len = strlen(key), value_len = strlen(value);
    if (key_len >= static_cast<size_t>(CONFIG_FIELD_LEN) ||
        value_len >= static_cast<size_t>(CONFIG_FIELD_LEN) || key_len + value_len > 97) {
        return "too long";
    }
    if (strcmp(key, "logpath") == 0) return log_path_value_fault(value);
    return nullptr;
}

int apply_config_message(LogController* controller, char* text) {
    (void)controller;
    char* message = trim(text);
    char shown[PRINTABLE_MAX];

    char* equal = strchr(message, '=');
    if (!equal) {
        HLOG(TAG_MAIN, WLOG_ERROR, "%s is not a valid configure",
             printable(message, shown, sizeof(shown)));
        return 1;
    }
    char key[CONTROL_MSG_MAX + 1];
    char value[CONTROL_MSG_MAX + 1];
    size_t key_len = static_cast<size_t>(equal - message);
    if (key_len >= sizeof(key)) key_len = sizeof(key) - 1;
    memcpy(key, message, key_len);
    key[key_len] = '\0';
    copy_str(value, sizeof(value), equal + 1);

    // Settings may be named with a prefix, e.g. a "sublog" group and an
    // underscore before the real key.
    const char* real_key = key;
    if (strstr(key, "sublog")) {
        const char* underscore = strchr(key, '_');
        if (!underscore) {
            HLOG(TAG_MAIN, WLOG_ERROR, "%s is not a valid configure",
                 printable(message, shown, sizeof(shown)));
            return 1;
        }
        real_key = underscore + 1;
    }
    const char* fault = config_fault(real_key, value);
    if (fault) {
        HLOG(TAG_MAIN, WLOG_ERROR, "%s is not a valid configure (%s)",
             printable(message, shown, sizeof(shown)), fault);
        return 0;
    }

    WLOG(TAG_MAIN, WLOG_DEBUG, "new config, key: %s, value:%s", real_key, value);
    ConfigCache cache;
    config_init(&cache);
    // A setting the file did not take is not stored, whatever the cache says.
    return config_change(&cache, real_key, value);
}
