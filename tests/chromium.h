// Loading the HTML report in the host's headless Chromium, for the tests that
// check the page a user opens. A build made with TAVLO_BROWSER_TESTS=OFF (the
// sanitizer and ARM suites: the browser is the same host program there, and
// its loads cost most of a suite's time) skips them.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <regex>
#include <string>

#ifndef TAVLO_BROWSER_TESTS
#define TAVLO_BROWSER_TESTS 1
#endif

// The browser's command, "" when this build skips browser tests or there is none.
// *why says which.
inline std::string chromium(std::string* why) {
    if (!TAVLO_BROWSER_TESTS) {
        *why = "headless Chromium runs in the native suite only (this build has TAVLO_BROWSER_TESTS=OFF, "
               "as tools/test.sh configures the --sanitize and --arm suites)";
        return "";
    }
    for (const char* name : {"chromium", "chromium-browser", "google-chrome"}) {
        const std::string cmd = std::string("command -v ") + name + " >/dev/null 2>&1";
        if (system(cmd.c_str()) == 0) return name;
    }
    *why = "no chromium (tools/install-deps.sh installs it)";
    return "";
}

inline std::string shell_quoted(const std::string& s) {
    std::string q = "'";
    for (char c : s) q += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return q + "'";
}

// Loads PAGE#FRAGMENT and returns the DOM once its scripts ran; EXTRA adds
// flags (a screenshot). The profile and the browser's messages stay in OUT_DIR.
inline std::string load_in_chromium(const std::string& browser, const std::filesystem::path& page,
                                    const std::string& fragment, const std::string& extra,
                                    const std::filesystem::path& out_dir) {
    // The budget is virtual time: it ends as soon as the page is idle, its
    // data inflated and its first screen drawn.
    const std::string cmd = "timeout 60 " + browser +
                            " --headless --disable-gpu --no-sandbox --no-first-run --hide-scrollbars"
                            " --window-size=1280,860 --virtual-time-budget=10000 --user-data-dir=" +
                            shell_quoted(out_dir / "profile") + " --dump-dom " + extra + " " +
                            shell_quoted("file://" + page.string() + "#" + fragment) + " 2>>" +
                            shell_quoted(out_dir / "chromium.log");
    std::string dom;
    FILE* p = popen(cmd.c_str(), "r");
    if (!p) return dom;
    char buf[65536];
    for (size_t n; (n = fread(buf, 1, sizeof buf, p)) > 0;) dom.append(buf, n);
    pclose(p);
    return dom;
}

// A number the page leaves on its body (data-shown, data-total), -1 when absent.
inline long page_number(const std::string& dom, const std::string& attribute) {
    std::smatch m;
    return std::regex_search(dom, m, std::regex(attribute + "=\"(\\d+)\"")) ? std::stol(m[1]) : -1;
}
