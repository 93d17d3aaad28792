/* vx-demo-haptics [SECONDS]: acts out the haptics client of a phone for a while, in C. */
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <time.h>

#include "vxreporting.h"

static const int64_t kReporter = 3001;
static int sent = 0, taken = 0, refused = 0, ended = 0, failed = 0;

static double clockSeconds(clockid_t clock) {
  struct timespec now;
  clock_gettime(clock, &now);
  return (double)now.tv_sec + (double)now.tv_nsec / 1e9;
}

static void complain(const char* text) {
  fprintf(stderr, "haptics: %s\n", text);
  failed = 1;
}

static void messageAnswered(const vxr_result* result, void* user) {
  (void)user;
  if (result->code == VXR_OK)
    ++taken;
  else if (result->code == VXR_REPORTING_ERROR)
    ++refused;
  else
    complain(result->text);
}

static void sessionEnded(const vxr_result* result, void* user) {
  (void)user;
  if (result->code == VXR_OK) ++ended;
}

static void sendMessage(vxr_client* client, const vxr_dict* message) {
  ++sent;
  if (vxr_send_message_to(client, message, 0x20000001, 6, &kReporter, 1, messageAnswered, NULL))
    complain(vxr_error_text(client));
}

/* Serves the connection for 400 ms. */
static void pass(vxr_client* client) {
  const double end = clockSeconds(CLOCK_MONOTONIC) + 0.4;
  double left = 0.4;
  while (left > 0 && vxr_process(client) == VXR_OK) {
    struct pollfd ready = {vxr_fd(client), POLLIN, 0};
    poll(&ready, 1, (int)(left * 1000) + 1);
    left = end - clockSeconds(CLOCK_MONOTONIC);
  }
}

static void play(vxr_client* client, double seconds) {
  static const char* const players[] = {"keyboard", "game"};
  const double end = clockSeconds(CLOCK_MONOTONIC) + seconds;
  vxr_dict* running = vxr_dict_new();
  vxr_dict* totals = vxr_dict_new();
  int i;
  vxr_dict_set_int(totals, "Haptic_Active_Hardware_Time_Seconds", 42);
  vxr_dict_set_strings(totals, "Active_Clients", players, 2);
  for (i = 1; vxr_is_connected(client) && clockSeconds(CLOCK_MONOTONIC) < end; ++i) {
    vxr_dict_set_double(running, "EngineOnTime", 0.015 * i);
    vxr_dict_set_double(running, "vxreporting_timestamp", clockSeconds(CLOCK_REALTIME));
    sendMessage(client, running);
    if (i == 4) sendMessage(client, totals);
    pass(client);
  }
  vxr_dict_free(running);
  vxr_dict_free(totals);
}

int main(int argc, char** argv) {
  vxr_client* client = vxr_client_new(NULL);
  vxr_dict* configuration = vxr_dict_new();
  prctl(PR_SET_NAME, "demo-haptics"); /* the name the service knows it by */
  if (vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) != VXR_OK) {
    complain(vxr_error_text(client));
    return 1;
  }
  vxr_dict_set_string(configuration, "HostApplicationDisplayID", "com.example.keyboard");
  vxr_create_session(client, kReporter, NULL, NULL);
  vxr_set_service_type(client, kReporter, 3, NULL, NULL);
  vxr_set_configuration(client, kReporter, configuration, NULL, NULL);
  vxr_start_session(client, kReporter, sessionEnded, NULL);
  play(client, argc > 1 ? atof(argv[1]) : 8);
  vxr_stop_session(client, kReporter, NULL, NULL);
  if (vxr_goodbye(client, VXR_DEFAULT_TIMEOUT) != VXR_OK) complain(vxr_error_text(client));
  printf(
      "haptics    sent %d messages: %d taken, %d refused while reporting was off; %d sessions "
      "ended in order\n",
      sent, taken, refused, ended);
  vxr_dict_free(configuration);
  vxr_client_free(client);
  return failed || sent != taken + refused;
}
