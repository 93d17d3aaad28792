/* Keeps a session, sends a message for each line of its input, and says of each what has become of
 * it. */
#include <stdio.h>
#include <stdlib.h>
#include <vxreporting.h>

int main(int argc, char** argv) {
  const int64_t id = argc > 1 ? atoll(argv[1]) : 0;
  char line[64];
  vxr_options options = VXR_OPTIONS_INIT;
  options.keep_sessions = true;
  vxr_client* client = vxr_client_new(&options);
  vxr_dict* message = vxr_dict_new();
  vxr_dict_set_double(message, "gain", 0.5);
  if (vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) != VXR_OK) return 1;
  vxr_create_session(client, id, NULL, NULL);
  vxr_set_service_type(client, id, 2, NULL, NULL);
  vxr_start_session(client, id, NULL, NULL);
  while (fgets(line, sizeof line, stdin) != NULL) {
    vxr_send_message_to(client, message, 5, 2, &id, 1, NULL, NULL);
    puts(vxr_wait(client, VXR_DEFAULT_TIMEOUT) == VXR_OK ? "accepted" : vxr_error_text(client));
    fflush(stdout);
  }
  vxr_stop_session(client, id, NULL, NULL);
  const int ended = vxr_goodbye(client, VXR_DEFAULT_TIMEOUT);
  vxr_dict_free(message);
  vxr_client_free(client);
  return ended;
}
