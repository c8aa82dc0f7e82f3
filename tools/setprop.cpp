// setprop NAME VALUE as on a phone; exits 1 with a message when the property
// store refuses (bad name, value over 91 characters, ro. already set).
#include <errno.h>
#include <stdio.h>
#include <string.h>

#include "platform/properties.h"

int main(int argc, char** argv) {
    if (argc != 3) {
        fprintf(stderr, "usage: setprop NAME VALUE\n");
        return 1;
    }
    if (property_set(argv[1], argv[2]) != 0) {
        fprintf(stderr, "setprop: failed to set property '%s' to '%s': %s\n", argv[1], argv[2],
                strerror(errno));
        return 1;
    }
    return 0;
}
