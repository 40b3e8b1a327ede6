/* A library an attacker preloads into a signed program. It hides how it came in: it overwrites
 * LD_PRELOAD in the environment the kernel shows in /proc/<pid>/environ, so that only its mapping
 * gives it away. The tests copy it into a directory anyone may write. */
#include <string.h>

extern char** environ;

__attribute__((constructor)) static void hide(void) {
    for (char** entry = environ; entry && *entry; ++entry) {
        if (strncmp(*entry, "LD_PRELOAD=", 11) == 0) memset(*entry, 'X', strlen(*entry));
    }
}
