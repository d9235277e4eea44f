/* vitd-example: runs one command of the demo-mode helper through
 * libvitdclient and prints what comes back.
 *
 *   vitd-example [-s SOCKET] COMMAND [PARAMETER-AS-JSON]
 *   vitd-example prepareWorkContainer '"/private/var/demo"'
 *   vitd-example createDeviceManifest '{"Path": "/private/var", "Inclusive": false}'
 *
 * Exit status: 0 the helper answered true, 1 it answered false, 2 no answer,
 * 64 usage. */
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <vitd_client.h>

static int print_message(const vitd_message *message, void *context) {
  const char *command = context;
  switch (message->kind) {
    case VITD_MESSAGE_PROGRESS:
      printf("%s: progress %lld%%\n", command, (long long)message->progress);
      break;
    case VITD_MESSAGE_DATA:
      printf("%s: %zu bytes of data\n", command, message->data_size);
      break;
    case VITD_MESSAGE_RESPONSE:
      printf("%s: response %s\n", command, message->response ? "true" : "false");
      break;
    case VITD_MESSAGE_OTHER: {
      char *json = vitd_value_to_json(message->object);
      printf("%s: message %s\n", command, json ? json : "?");
      free(json);
      break;
    }
  }
  return 0; /* go on */
}

int main(int argc, char **argv) {
  const char *socket_path = NULL; /* the helper's usual socket */
  int option;
  while ((option = getopt(argc, argv, "+s:")) != -1) {
    if (option != 's') return 64;
    socket_path = optarg;
  }
  if (argc - optind < 1 || argc - optind > 2) {
    fprintf(stderr, "usage: %s [-s SOCKET] COMMAND [PARAMETER-AS-JSON]\n", argv[0]);
    return 64;
  }
  const char *command = argv[optind];
  vitd_value *parameter = NULL; /* none: the command gets true */
  if (argc - optind == 2 && vitd_value_from_json(argv[optind + 1], &parameter) != VITD_OK) {
    fprintf(stderr, "%s: the parameter is not JSON\n", argv[0]);
    return 64;
  }

  vitd_client *client;
  int status = vitd_connect(socket_path, &client);
  if (status == VITD_OK) {
    int response = 0;
    status = vitd_call(client, command, parameter, print_message, (void *)command, &response);
    vitd_disconnect(client);
    if (status == VITD_OK) {
      vitd_value_free(parameter);
      return response ? 0 : 1;
    }
  }
  fprintf(stderr, "%s: %s: %s\n", argv[0], command, vitd_strerror(status));
  vitd_value_free(parameter);
  return 2;
}
