/* An audio render callback that reports a counter every buffer through libtavrin's real-time
 * send, in C. There is no sound card here: main() calls the callback as an audio driver would,
 * every 5.3 ms (256 frames at 48 kHz), from a thread of its own.
 *
 * Build: see CMakeLists.txt or Makefile. Run: ./render_callback [SOCKET] */
#define _POSIX_C_SOURCE 200809L /* nanosleep */

#include <stdint.h>
#include <stdio.h>
#include <time.h>

#include <tavrin/tavrin.h>

enum { kFrames = 256, kBuffers = 20 };
static const int64_t kReporter = 0x5eed;

/* Called by the audio driver for every buffer: it must not block, lock or allocate. */
static void render(tavrin_client* reporting, float* out, int frames, int64_t buffer) {
  for (int i = 0; i < frames; ++i) out[i] = 0.0f; /* silence, the work of a real callback */
  const tavrin_field fields[] = {
      {"buffer", TAVRIN_FIELD_INT, {.i = buffer}},
      {"frames", TAVRIN_FIELD_INT, {.i = frames}},
  };
  /* Category 2 (Session), type 3: a dropped report is counted, never waited for. */
  tavrin_send_rt(reporting, &kReporter, 1, 2, 3, fields, 2);
}

int main(int argc, char** argv) {
  tavrin_status status;
  tavrin_client* reporting = tavrin_open(argc > 1 ? argv[1] : NULL, 1024, &status);
  if (reporting == NULL) {
    fprintf(stderr, "cannot reach the tavrin service (status %d)\n", (int)status);
    return 1;
  }
  /* Sessions are opened outside the audio thread: these calls wait for the service. */
  if (tavrin_create_session(reporting, kReporter, 0,
                            "{\"HostApplicationDisplayID\": \"render\"}") != TAVRIN_OK ||
      tavrin_start_session(reporting, kReporter) != TAVRIN_OK) {
    fprintf(stderr, "cannot open a session\n");
    tavrin_close(reporting);
    return 1;
  }
  float out[kFrames];
  const struct timespec period = {0, 5333333};
  for (int64_t buffer = 0; buffer < kBuffers; ++buffer) {
    render(reporting, out, kFrames, buffer);
    nanosleep(&period, NULL);
  }
  tavrin_stop_session(reporting, kReporter);
  printf("rendered %d buffers, %llu reports sent, %llu dropped\n", kBuffers,
         (unsigned long long)tavrin_rt_sent(reporting),
         (unsigned long long)tavrin_rt_dropped(reporting));
  tavrin_close(reporting);
  return 0;
}
