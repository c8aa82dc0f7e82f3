// getprop as on a phone: no argument lists every property as "[name]: [value]",
// a name prints its value, a name and a default print the value or the default.
#include <stdio.h>

#include "platform/properties.h"

static void print_property(const char* key, const char* value, void*) {
    printf("[%s]: [%s]\n", key, value);
}

int main(int argc, char** argv) {
    if (argc > 3) {
        fprintf(stderr, "usage: getprop [NAME [DEFAULT]]\n");
        return 1;
    }
    if (argc == 1) {
        if (property_list(print_property, nullptr) != 0) {
            fprintf(stderr, "getprop: cannot read the properties\n");
            return 1;
        }
        return 0;
    }
    char value[PROPERTY_VALUE_MAX];
    property_get(argv[1], value, argc == 3 ? argv[2] : "");
    printf("%s\n", value);
    return 0;
}
