/* What a program in C sees of the library, with the real service at VXREPORTING_SOCKET. */
#include <poll.h>
#include <stdio.h>
#include <string.h>

#include "vxreporting.h"

static int failures = 0;
#define EXPECT(condition)                                             \
  do {                                                                \
    if (!(condition)) {                                               \
      fprintf(stderr, "%s:%d: %s\n", __FILE__, __LINE__, #condition); \
      ++failures;                                                     \
    }                                                                 \
  } while (0)

static void remember(const vxr_result* result, void* user) {
  *(int64_t*)user = result->code == VXR_OK ? result->value : -result->code;
}

static void firstReporter(const vxr_result* result, void* user) {
  *(int64_t*)user = result->identifier_count == 1 ? result->identifiers[0] : -1;
}

static void countAndFree(const vxr_result* result, void* user) {
  vxr_client** client = user;
  EXPECT(result->code == VXR_OK);
  vxr_client_free(*client);
  EXPECT(vxr_process(*client) == VXR_INVALID_ARGUMENT);
  *client = NULL;
}

static vxr_dict* everyKind(void) {
  const int64_t ints[] = {1, -2};
  const double doubles[] = {0.5};
  const char* const strings[] = {"keyboard", "game"};
  vxr_dict* inner = vxr_dict_new();
  vxr_dict* dict = vxr_dict_new();
  EXPECT(vxr_dict_set_string(inner, "route", "Speaker") == VXR_OK);
  EXPECT(vxr_dict_set_int(dict, "frames", -3) == VXR_OK);
  EXPECT(vxr_dict_set_double(dict, "gain", 0.5) == VXR_OK);
  EXPECT(vxr_dict_set_bool(dict, "on", true) == VXR_OK);
  EXPECT(vxr_dict_set_date(dict, "at", 0) == VXR_OK);
  EXPECT(vxr_dict_set_dict(dict, "inner", inner) == VXR_OK);
  EXPECT(vxr_dict_set_ints(dict, "ints", ints, 2) == VXR_OK);
  EXPECT(vxr_dict_set_doubles(dict, "doubles", doubles, 1) == VXR_OK);
  EXPECT(vxr_dict_set_strings(dict, "names", strings, 2) == VXR_OK);
  vxr_dict_free(inner);
  return dict;
}

static void wholeLife(void) {
  const int64_t ids[] = {42};
  int64_t started = 0, reporter = 0, type = 0, all = 0;
  vxr_client* client = vxr_client_new(NULL);
  vxr_dict* dict = everyKind();
  EXPECT(vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(vxr_is_connected(client) && vxr_fd(client) >= 0);
  EXPECT(vxr_create_session(client, 42, NULL, NULL) == VXR_OK);
  EXPECT(vxr_set_service_type(client, 42, 7, NULL, NULL) == VXR_OK);
  EXPECT(vxr_set_configuration(client, 42, dict, NULL, NULL) == VXR_OK);
  EXPECT(vxr_start_session(client, 42, remember, &started) == VXR_OK);
  EXPECT(vxr_send_message(client, dict, 0x08000005, 1, NULL, NULL) == VXR_OK);
  EXPECT(vxr_send_message_to(client, dict, 3, 0, ids, 1, NULL, NULL) == VXR_OK);
  EXPECT(vxr_get_service_type(client, 42, remember, &type) == VXR_OK);
  EXPECT(vxr_validate_reporter(client, 42, remember, &reporter) == VXR_OK);
  EXPECT(vxr_get_reporters(client, firstReporter, &all) == VXR_OK);
  EXPECT(vxr_wants_write(client) && vxr_flush(client) == VXR_OK);
  EXPECT(vxr_wait(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(type == 7 && reporter == 42 && all == 42 && started == 0);
  EXPECT(vxr_stop_session(client, 42, NULL, NULL) == VXR_OK);
  EXPECT(vxr_goodbye(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(started == 1 && !vxr_is_connected(client) && vxr_fd(client) == -1);
  vxr_dict_free(dict);
  vxr_client_free(client);
}

static void failuresHaveCodesAndTexts(void) {
  const char* const strings[] = {"a", NULL};
  int64_t abandoned = 0, dropped = 0;
  const vxr_options small = {sizeof small, 4096, 3, false};
  vxr_client* client = vxr_client_new(&small);
  vxr_dict* dict = vxr_dict_new();
  int level;
  EXPECT(vxr_create_session(client, 1, NULL, NULL) == VXR_NOT_CONNECTED);
  EXPECT(vxr_connect(client, "/nonexistent/socket", 10) == VXR_NOT_CONNECTED);
  EXPECT(strstr(vxr_error_text(client), "/nonexistent/socket: No such file") != NULL);
  EXPECT(vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(vxr_send_message(client, NULL, 1, 1, NULL, NULL) == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_send_message_to(client, dict, 1, 1, NULL, 1, NULL, NULL) == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_process(NULL) == VXR_INVALID_ARGUMENT && vxr_fd(NULL) == -1);
  EXPECT(vxr_dict_set_string(dict, NULL, "x") == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_dict_set_string(dict, "x", NULL) == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_dict_set_strings(dict, "x", strings, 2) == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_dict_set_int(NULL, "x", 1) == VXR_INVALID_ARGUMENT);
  for (level = 2; level <= 32; ++level) EXPECT(vxr_dict_set_dict(dict, "x", dict) == VXR_OK);
  EXPECT(vxr_dict_set_dict(dict, "x", dict) == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_send_message(client, dict, 1, 1, NULL, NULL) == VXR_OK);
  EXPECT(vxr_wait(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(strcmp(vxr_code_text(VXR_INTERNAL_ERROR), vxr_code_text(99)) != 0);

  EXPECT(vxr_create_session(client, 1, NULL, NULL) == VXR_OK);
  EXPECT(vxr_start_session(client, 1, remember, &abandoned) == VXR_OK);
  EXPECT(vxr_destroy_session(client, 1, NULL, NULL) == VXR_OK);
  EXPECT(vxr_create_session(client, 2, NULL, NULL) == VXR_BUFFER_FULL);
  EXPECT(strstr(vxr_error_text(client), "3 calls wait") != NULL);
  EXPECT(vxr_wait(client, 0) == VXR_TIMED_OUT);
  EXPECT(vxr_wait(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  while (abandoned == 0) { /* may come after the answer to what has ended it */
    struct pollfd ready = {vxr_fd(client), POLLIN, 0};
    EXPECT(poll(&ready, 1, 20000) == 1 && vxr_process(client) == VXR_OK);
  }
  EXPECT(abandoned == -VXR_REFUSED);
  EXPECT(vxr_create_session(client, 3, remember, &dropped) == VXR_OK);
  EXPECT(vxr_create_session(client, 4, NULL, NULL) == VXR_OK);
  vxr_disconnect(client);
  EXPECT(dropped == -VXR_DISCONNECTED);
  EXPECT(vxr_wait(client, 0) == VXR_DISCONNECTED);
  EXPECT(strstr(vxr_error_text(client), "disconnected by the caller") != NULL);
  vxr_dict_free(dict);
  vxr_client_free(client);
}

static void aRingOfNumbers(void) {
  const vxr_key keys[] = {{"frames", VXR_INTEGER}, {"peak", VXR_DOUBLE}, {"on", VXR_BOOLEAN}};
  const vxr_key wrong[] = {{"x", 3}};
  const int64_t ids[] = {6};
  vxr_number numbers[3];
  vxr_realtime* ring = vxr_realtime_new(keys, 3, 4, 0, ids, 1, 1);
  vxr_client* client = vxr_client_new(NULL);
  numbers[0].integer = -3;
  numbers[1].real = 0.5;
  numbers[2].integer = 1;
  EXPECT(vxr_realtime_new(wrong, 1, 4, 0, NULL, 0, 1) == NULL);
  EXPECT(vxr_realtime_send(ring, numbers, 3));
  EXPECT(!vxr_realtime_send(ring, numbers, 3) && !vxr_realtime_send(ring, numbers, 2));
  EXPECT(vxr_realtime_dropped(ring) == 2);
  EXPECT(vxr_realtime_process(ring, client) == VXR_NOT_CONNECTED);
  EXPECT(vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(vxr_create_session(client, 6, NULL, NULL) == VXR_OK);
  EXPECT(vxr_start_session(client, 6, NULL, NULL) == VXR_OK);
  EXPECT(vxr_realtime_process(ring, client) == VXR_OK);
  EXPECT(vxr_realtime_process(NULL, client) == VXR_INVALID_ARGUMENT);
  EXPECT(vxr_goodbye(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  vxr_client_free(client);
  vxr_realtime_free(ring);
}

static void aCallbackMayFreeTheClient(void) {
  vxr_client* client = vxr_client_new(NULL);
  vxr_client* alive = client;
  EXPECT(vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(vxr_create_session(client, 5, countAndFree, &alive) == VXR_OK);
  vxr_wait(client, VXR_DEFAULT_TIMEOUT);
  EXPECT(alive == NULL);
}

/* With keep_sessions; whoever runs this restarts the service between the two lines. */
static void outliveTheService(void) {
  vxr_options options = VXR_OPTIONS_INIT;
  vxr_counters counters;
  vxr_dict* dict = vxr_dict_new();
  int64_t stopped = 0;
  vxr_client* client;
  options.keep_sessions = true;
  client = vxr_client_new(&options);
  EXPECT(vxr_retry_in_ms(client) == -1);
  EXPECT(vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(vxr_create_session(client, 7, NULL, NULL) == VXR_OK);
  EXPECT(vxr_set_service_type(client, 7, 2, NULL, NULL) == VXR_OK);
  EXPECT(vxr_start_session(client, 7, remember, &stopped) == VXR_OK);
  EXPECT(vxr_wait(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  puts("started");
  fflush(stdout);
  EXPECT(getchar() == '\n'); /* it is gone */
  while (vxr_is_connected(client)) EXPECT(vxr_process(client) == VXR_OK);
  EXPECT(vxr_retry_in_ms(client) >= 0);
  EXPECT(vxr_dict_set_string(dict, "sent", "while it was away") == VXR_OK);
  EXPECT(vxr_send_message(client, dict, 3, 0, NULL, NULL) == VXR_OK);
  EXPECT(vxr_wait(client, 0) == VXR_TIMED_OUT);
  puts("sent");
  fflush(stdout);
  EXPECT(vxr_wait(client, 20000) == VXR_OK);
  EXPECT(vxr_stop_session(client, 7, NULL, NULL) == VXR_OK);
  EXPECT(vxr_wait(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  EXPECT(stopped == 1);
  EXPECT(vxr_get_counters(client, &counters, sizeof counters) == VXR_OK);
  EXPECT(counters.reconnections == 1 && counters.unanswered == 0 && counters.dropped == 0);
  EXPECT(vxr_goodbye(client, VXR_DEFAULT_TIMEOUT) == VXR_OK);
  vxr_dict_free(dict);
  vxr_client_free(client);
}

int main(int count, char** arguments) {
  (void)arguments;
  if (count > 1) {
    outliveTheService();
    return failures != 0;
  }
  wholeLife();
  failuresHaveCodesAndTexts();
  aRingOfNumbers();
  aCallbackMayFreeTheClient();
  puts(failures == 0 ? vxr_version() : "failed");
  return failures != 0;
}
