/* A plug-in written in C over libannexa, which spawn_test runs through spawnd: it answers each
 * message with {"echo": MESSAGE}, and the message "busy" also takes a busy assertion. */
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "Annexa/c/annexa.h"

static char* echo(const char* message, void* context) {
    (void)context;
    if (strcmp(message, "\"busy\"") == 0) annexa_plugin_begin_busy("written in C");
    size_t size = strlen(message) + 16;
    char* reply = malloc(size);
    if (reply) snprintf(reply, size, "{\"echo\": %s}", message);
    return reply;
}

int main(void) {
    int64_t served = annexa_plugin_run(echo, NULL);
    if (served != 0) fprintf(stderr, "annexa_c_plugin: not launched by spawnd\n");
    return served == 0 ? 0 : 1;
}
