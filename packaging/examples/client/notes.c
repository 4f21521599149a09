/* SPDX-License-Identifier: Apache-2.0 */
/* Finds the container of org.example.notes, makes it when there is none, and counts its own starts in an info value.
 *
 *     cc -std=c99 notes.c $(pkg-config --cflags --libs zorvane) -o notes && ./notes */
#include <zorvane/zorvane.h>

#include <inttypes.h>
#include <stdio.h>
#include <string.h>

static int fail(const zorvane_error *error)
{
    fprintf(stderr, "notes: %s\n", error->message);
    if (*error->advice != '\0')
        fprintf(stderr, "notes: %s\n", error->advice);
    return (int)error->kind;
}

/* ZORVANE_OK, or the kind of the error. */
static int count_start(zorvane_client *client, const zorvane_address *notes, int64_t *starts, zorvane_error *error)
{
    zorvane_result *stored = NULL;
    int kind = zorvane_call(client, zorvane_request_info(notes, "starts"), &stored, error);
    if (kind != ZORVANE_OK && kind != ZORVANE_NOT_FOUND)
        return kind;
    *starts = zorvane_value_get_integer(zorvane_result_value(stored)) + 1;
    zorvane_result_free(stored);

    zorvane_value *value = zorvane_value_integer(*starts);
    kind = zorvane_call(client, zorvane_request_set_info(notes, "starts", value), NULL, error);
    zorvane_value_free(value);
    return kind;
}

int main(int count, char **arguments)
{
    zorvane_error error;
    zorvane_client *client = zorvane_connect(count > 1 ? arguments[1] : NULL, ZORVANE_TIMEOUT_DEFAULT, &error);
    if (client == NULL)
        return fail(&error);

    zorvane_address notes = {ZORVANE_DATA_APPLICATION, ZORVANE_CURRENT_USER, "org.example.notes", {0}};
    zorvane_result *found = NULL;
    int64_t starts = 0;
    int kind = zorvane_call(
        client, zorvane_request_lookup(notes.container_class, notes.user, notes.identifier, ZORVANE_CREATE), &found,
        &error);
    if (kind == ZORVANE_OK) {
        memcpy(notes.uuid, zorvane_result_uuid(found), sizeof notes.uuid);
        kind = count_start(client, &notes, &starts, &error);
    }
    if (kind == ZORVANE_OK)
        printf("%s, start %" PRId64 "\n", zorvane_result_path(found), starts);
    else
        fail(&error);
    zorvane_result_free(found);
    zorvane_client_free(client);
    return kind;
}
