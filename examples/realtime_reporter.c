/* A reporter in the shape of an audio component: a real-time callback that must never
 * block or allocate reports every period with mxr_send_rt(), while the component's
 * other threads open the client and its session and close them.
 *
 *   cc realtime_reporter.c $(pkg-config --cflags --libs mxreporting) -lpthread
 *   ./realtime_reporter [PERIODS]
 */
#define _POSIX_C_SOURCE 200809L

#include <inttypes.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <mxreporting/mxreporting.h>

#define REPORTER 42
#define SERVICE_LONG_FORM_AUDIO 7
#define CATEGORY_SESSION_PLAYBACK 0x08000003u
#define TYPE_GENERIC 0

struct engine {
    mxr_client *client;
    int periods;
    int dropped; /* reports the ring could not take: counted, never waited for */
};

/* What an audio server's real-time thread would call every period: nothing in it may
 * block, allocate or take a lock, and mxr_send_rt() does none of these. */
static void audio_callback(struct engine *engine, int period)
{
    mxr_field fields[] = {
        {.key = "period", .kind = MXR_INT, .value.i = period},
        {.key = "peak_level", .kind = MXR_DOUBLE, .value.d = -12.0 + (period % 7)},
        {.key = "route", .kind = MXR_STRING, .value.s = "Speaker"},
        {.key = "underrun", .kind = MXR_BOOL, .value.b = period % 50 == 49},
    };
    if (mxr_send_rt(engine->client, REPORTER, CATEGORY_SESSION_PLAYBACK, TYPE_GENERIC, fields, 4) < 0)
        engine->dropped++;
}

static void *audio_thread(void *argument)
{
    struct engine *engine = argument;
    struct timespec period = {.tv_sec = 0, .tv_nsec = 5 * 1000 * 1000};
    for (int i = 0; i < engine->periods; i++) {
        audio_callback(engine, i);
        nanosleep(&period, NULL);
    }
    return NULL;
}

static int check(int result, const char *what)
{
    if (result < 0)
        fprintf(stderr, "realtime_reporter: %s: %s\n", what, mxr_strerror(result));
    return result;
}

int main(int argc, char **argv)
{
    struct engine engine = {.client = NULL, .periods = argc > 1 ? atoi(argv[1]) : 200, .dropped = 0};
    if (check(mxr_client_open(&engine.client, NULL), "open") < 0)
        return 2;

    mxr_payload *configuration = mxr_payload_new();
    if (!configuration || check(mxr_payload_add_string(configuration, "HostApplicationDisplayID", "example.player"),
                                "configuration") < 0)
        return 1;
    int failed = check(mxr_session_create(engine.client, REPORTER), "create") < 0 ||
        check(mxr_session_set_service_type(engine.client, REPORTER, SERVICE_LONG_FORM_AUDIO), "type") < 0 ||
        check(mxr_session_set_configuration(engine.client, REPORTER, configuration), "configure") < 0 ||
        check(mxr_session_start(engine.client, REPORTER), "start") < 0;
    mxr_payload_free(configuration);
    if (failed)
        return 1;

    pthread_t thread;
    if (pthread_create(&thread, NULL, audio_thread, &engine) != 0)
        return 1;
    pthread_join(thread, NULL);

    /* The stop comes after every report the ring took: one connection keeps them in order. */
    if (check(mxr_session_stop(engine.client, REPORTER), "stop") < 0)
        return 1;
    uint64_t sent = 0, dropped = 0, refused = 0;
    mxr_client_get_rt_counts(engine.client, &sent, &dropped, &refused);
    printf("realtime_reporter: %d periods: %" PRIu64 " reports taken, %" PRIu64 " dropped, %" PRIu64 " refused\n",
           engine.periods, sent, dropped, refused);
    mxr_session_destroy(engine.client, REPORTER);
    mxr_client_close(engine.client);
    return sent + dropped + refused == (uint64_t)engine.periods ? 0 : 1;
}
