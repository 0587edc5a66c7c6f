/* A minimal C application of libbexil: asks bxd for its plug-ins and prints the reply as JSON.
   Build: make (uses pkg-config bexil). Exit status 0 when the daemon answered, whatever the answer. */

#include <bexil/bexil-c.h>
#include <stdio.h>

int main(void) {
    bexil_error* error = NULL;
    bexil_client* client = bexil_client_new(NULL, &error);
    if (client == NULL) {
        printf("no client: %s\n", bexil_error_message(error));
        bexil_error_free(error);
        return 1;
    }
    printf("libbexil %s (C), service %s\n", bexil_version(), bexil_client_service(client));
    char* reply = NULL;
    int status = 0;
    if (bexil_match(client, "{}", 0, &reply, &error) == BEXIL_OK) {
        printf("match: %s\n", reply);
    } else if (bexil_error_no_reply(error)) {
        printf("bxd is not reachable: %s\n", bexil_error_message(error));
        status = 1;
    } else {
        printf("match: code %d: %s\n", bexil_error_code(error), bexil_error_message(error));
    }
    bexil_free(reply);
    bexil_error_free(error);
    bexil_client_free(client);
    return status;
}
