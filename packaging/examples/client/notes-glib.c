/* SPDX-License-Identifier: Apache-2.0 */
/* Finds the container of org.example.notes without waiting for it, in GLib's main loop. Any other loop that watches
 * descriptors is used in the same way.
 *
 *     cc notes-glib.c $(pkg-config --cflags --libs zorvane glib-2.0) -o notes-glib && ./notes-glib */
#include <zorvane/zorvane.h>

#include <glib-unix.h>

static GMainLoop *loop;
static int ending = 0;

static void on_found(void *data, zorvane_result *result, const zorvane_error *error)
{
    (void)data;
    if (error != NULL) {
        g_printerr("notes: %s\n", error->message);
        ending = (int)error->kind;
    } else {
        g_print("%s, found\n", zorvane_result_path(result));
    }
    zorvane_result_free(result);
    g_main_loop_quit(loop);
}

static gboolean on_answers(gint descriptor, GIOCondition condition, gpointer async)
{
    (void)descriptor;
    (void)condition;
    zorvane_async_dispatch(async);
    return G_SOURCE_CONTINUE;
}

int main(int count, char **arguments)
{
    zorvane_error error;
    zorvane_async *async = zorvane_async_new(count > 1 ? arguments[1] : NULL, ZORVANE_TIMEOUT_DEFAULT, &error);
    zorvane_request *lookup = zorvane_request_lookup(ZORVANE_DATA_APPLICATION, ZORVANE_CURRENT_USER, "org.example.notes",
                                                     ZORVANE_CREATE);
    if (async == NULL || zorvane_async_start(async, lookup, on_found, NULL, &error) == 0) {
        g_printerr("notes: %s\n", error.message);
        return 1;
    }
    loop = g_main_loop_new(NULL, FALSE);
    guint source = g_unix_fd_add(zorvane_async_fd(async), G_IO_IN, on_answers, async);
    g_main_loop_run(loop);
    g_source_remove(source);
    g_main_loop_unref(loop);
    zorvane_async_free(async);
    return ending;
}
