/* A host written in C: drives the daemon through libannexa and prints what it gets, one line per
 * call, for the integration test to compare.
 *     annexa_c_client APP_PATH PLUGIN_UUID */
#include <inttypes.h>
#include <stdio.h>
#include <string.h>

#include "Annexa/c/annexa.h"

static void line(const char* what, int64_t code, char* text) {
    printf("%s: %" PRId64 " %s\n", what, code, text ? text : "-");
    annexa_free(text);
}

int main(int argc, char** argv) {
    if (argc != 3) {
        fprintf(stderr, "usage: annexa_c_client APP_PATH PLUGIN_UUID\n");
        return 64;
    }
    annexa_client* client = annexa_client_create(NULL);
    if (!client) return 70;
    char* text = NULL;
    char* error = NULL;
    int64_t code = annexa_send(client, "{\"request\": \"bulk\", \"version\": 3u}", &text, &error);
    line("send", code, text);
    annexa_free(error);
    code = annexa_send(client, "{not the notation", &text, &error);
    line("send garbage", code, error);

    const char* paths[] = {argv[1]};
    code = annexa_add(client, paths, 1, &text);
    line("add", code, text);
    const char* relative[] = {"relative/App.app"};
    code = annexa_add(client, relative, 1, &text);
    line("add relative", code, text);

    const char* uuids[] = {argv[2]};
    code = annexa_annotate(client, uuids, 1, "{\"election\": 1}", &text);
    line("annotate", code, text);
    code = annexa_annotate(client, uuids, 1, "{\"election\": \"1\"}", &text);
    line("annotate string election", code, text);
    const char* bad[] = {"not-a-uuid"};
    code = annexa_annotate(client, bad, 1, "{\"election\": 1}", &text);
    line("annotate bad uuid", code, text);

    char* found = NULL;
    code = annexa_match(client, "{\"KSExtensionIdentifier\": \"com.example.One\"}", 0, &found, &text);
    printf("match: %" PRId64 " %s\n", code, found && strstr(found, "\"identifier\": \"com.example.One\"") ? "One" : "-");
    annexa_free(found);
    annexa_free(text);
    code = annexa_match(client, "{bad", 0, &found, &text);
    line("match garbage", code, text);

    /* Activation without spawnd running: ready fails with the daemon's text; the rest needs no
     * service manager. */
    code = annexa_ready(client, uuids, 1, &text);
    printf("ready: %" PRId64 " %s\n", code, text && strstr(text, "unable to enable plug-in com.example.One(") ? "unable" : "-");
    annexa_free(text);
    char* tokens = NULL;
    const char* twice[] = {argv[2], argv[2]};
    code = annexa_access(client, twice, 2, &tokens, &text);
    printf("access: %" PRId64 " %s\n", code,
           tokens && strstr(tokens, "com.corvane.sandbox.read-only;") && strchr(tokens, ',') ? "two tokens" : "-");
    annexa_free(tokens);
    annexa_free(text);
    char plugIn[512];
    snprintf(plugIn, sizeof plugIn, "%s/PlugIns/One.appex", argv[1]);
    const char* held[] = {plugIn};
    char* token = NULL;
    code = annexa_lock(client, held, 1, 2, &token, &text);
    printf("lock: %" PRId64 " %s\n", code, token && strlen(token) == 36 ? "token" : "-");
    annexa_free(text);
    code = annexa_ready(client, uuids, 1, &text);
    line("ready while held", code, text);
    code = annexa_unlock(client, token, &text);
    line("unlock", code, text);
    annexa_free(token);
    code = annexa_lock(client, held, 1, 3, &token, &text);
    line("lock bad flags", code, text);
    void* receipt = NULL;
    size_t size = 0;
    code = annexa_receipt(client, &receipt, &size, &text);
    line("receipt", code, text);
    annexa_free(receipt);

    char table[200];
    snprintf(table, sizeof table, "{\"%s\": {\"from\": \"C\"}}", argv[2]);
    code = annexa_bulk_annotate(client, table, &text);
    line("bulk-annotate", code, text);

    /* JSON: the same calls read and answer JSON, and a watch sees an annotation as it happens. */
    printf("notation 7: %" PRId64 "\n", annexa_client_set_notation(client, 7));
    annexa_client_set_notation(client, ANNEXA_NOTATION_JSON);
    code = annexa_send(client, "{\"request\": \"bulk\", \"version\": 3}", &text, &error);
    line("json send", code, text);
    code = annexa_match(client, "{\"KSExtensionIdentifier\": \"com.example.One\"}", 0, &found, &text);
    printf("json match: %" PRId64 " %s\n", code, found && strstr(found, "\"hubProtocolVersion\":2,") ? "plain numbers" : found);
    annexa_free(found);
    annexa_free(text);
    annexa_watch* watch = annexa_watch_start(client, &text);
    printf("watch: %s\n", watch && annexa_watch_fd(watch) >= 0 ? "started" : text);
    annexa_free(text);
    char* event = NULL;
    code = annexa_watch_next(watch, 0, &event, &text);
    line("watch nothing yet", code, text);
    code = annexa_annotate(client, uuids, 1, "{\"election\": 0}", &text);
    line("json annotate", code, text);
    code = annexa_watch_next(watch, 5000, &event, &text);
    printf("watch event: %" PRId64 " %s\n", code, event && strstr(event, "\"event\":\"annotation\"") ? "annotation" : event);
    annexa_free(event);
    annexa_free(text);
    annexa_watch_stop(watch);
    code = annexa_annotate(client, uuids, 1, "{\"election\": 1u}", &text);
    line("json annotate in the text notation", code, text);
    annexa_client_set_notation(client, ANNEXA_NOTATION_TEXT);

    code = annexa_remove(client, paths, 1, &text);
    line("remove", code, text);
    annexa_client_destroy(client);

    annexa_client* nobody = annexa_client_create("com.nobody.here");
    code = annexa_add(nobody, paths, 1, &text);
    line("unreachable", code, text);
    code = annexa_send(nobody, "{}", &text, &error);
    line("send unreachable", code, error);
    annexa_client_destroy(nobody);
    return 0;
}
