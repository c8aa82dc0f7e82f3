// The phone's `log` command: writes one entry into a logger buffer, in the
// spirit of Android's own.
//
//   log [-b main|system|radio] [-p PRIORITY] [-t TAG] [-H PID,TID,SEC,NSEC] MESSAGE...
//   log -b events -t TAGNUMBER [-H PID,TID,SEC,NSEC] VALUE...
//
// PRIORITY is one of v d i w e f (default i) or a number; TAG defaults to
// "log"; the words of MESSAGE are joined by spaces, and without any, each line
// of standard input becomes one entry. An events VALUE is i:INT, l:INT,
// f:FLOAT or s:TEXT, with "[" and "]" around a list; several values are
// written as one list. -H (root only) gives the entry's header instead of the
// writer's pid and tid and the present time.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "platform/logger_write.h"

namespace {

int usage() {
    fprintf(stderr,
            "usage: log [-b main|system|radio] [-p v|d|i|w|e|f|N] [-t TAG] [-H PID,TID,SEC,NSEC] MESSAGE...\n"
            "       log -b events -t TAGNUMBER [-H PID,TID,SEC,NSEC] i:INT|l:INT|f:FLOAT|s:TEXT|[|]...\n");
    return 2;
}

int priority_of(const char* text) {
    static const char letters[] = "vdiwef";  // 2 (verbose) to 7 (fatal)
    if (text[0] != '\0' && text[1] == '\0' && strchr(letters, text[0]) != nullptr)
        return 2 + static_cast<int>(strchr(letters, text[0]) - letters);
    char* end;
    long n = strtol(text, &end, 10);
    return end != text && *end == '\0' && n >= 0 && n <= 255 ? static_cast<int>(n) : -1;
}

bool parse_header(const char* text, LoggerHeader* header) {
    long long pid, tid, sec, nsec;
    int used = 0;
    if (sscanf(text, "%lld,%lld,%lld,%lld%n", &pid, &tid, &sec, &nsec, &used) != 4 || text[used] != '\0')
        return false;
    *header = {};
    header->pid = static_cast<int32_t>(pid);
    header->tid = static_cast<int32_t>(tid);
    header->sec = static_cast<int32_t>(sec);
    header->nsec = static_cast<int32_t>(nsec);
    return true;
}

int write_text(const char* buffer, int priority, const char* tag, const char* message, const LoggerHeader* header) {
    uint8_t payload[LOGGER_MAX_PAYLOAD];
    size_t n = logger_text_payload(priority, tag, message, payload, sizeof(payload));
    if (logger_write(buffer, payload, n, header)) return 0;
    fprintf(stderr, "log: cannot write to %s: %s\n", buffer, strerror(errno));
    return 1;
}

}  // namespace

int main(int argc, char** argv) {
    const char* buffer = "main";
    const char* tag = nullptr;
    int priority = 4;
    LoggerHeader header_value;
    const LoggerHeader* header = nullptr;
    int opt;
    while ((opt = getopt(argc, argv, "b:p:t:H:")) != -1) {
        switch (opt) {
            case 'b': buffer = optarg; break;
            case 'p':
                priority = priority_of(optarg);
                if (priority < 0) return usage();
                break;
            case 't': tag = optarg; break;
            case 'H':
                if (!parse_header(optarg, &header_value)) return usage();
                header = &header_value;
                break;
            default: return usage();
        }
    }
    if (logger_buffer_by_name(buffer) < 0) return usage();

    if (strcmp(buffer, "events") == 0) {
        char* end = nullptr;
        long long number = tag != nullptr ? strtoll(tag, &end, 10) : -1;
        if (end == tag || end == nullptr || *end != '\0' || number < 0 || number > INT32_MAX || optind == argc)
            return usage();
        uint8_t payload[LOGGER_MAX_PAYLOAD];
        long n = logger_event_payload(static_cast<int32_t>(number), argv + optind, argc - optind, payload,
                                      sizeof(payload));
        if (n < 0) {
            fprintf(stderr, "log: bad event values\n");
            return usage();
        }
        if (logger_write(buffer, payload, static_cast<size_t>(n), header)) return 0;
        fprintf(stderr, "log: cannot write to events: %s\n", strerror(errno));
        return 1;
    }

    if (tag == nullptr) tag = "log";
    if (optind < argc) {
        std::string message = argv[optind];
        for (int i = optind + 1; i < argc; i++) message += std::string(" ") + argv[i];
        return write_text(buffer, priority, tag, message.c_str(), header);
    }
    char* line = nullptr;
    size_t cap = 0;
    ssize_t len;
    int rc = 0;
    while (rc == 0 && (len = getline(&line, &cap, stdin)) >= 0) {
        if (len > 0 && line[len - 1] == '\n') line[len - 1] = '\0';
        rc = write_text(buffer, priority, tag, line, header);
    }
    free(line);
    return rc;
}
