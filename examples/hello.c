#include <ostrel/reporting.h>

int main(void) {
  const int64_t session = 4711;
  ostrel_client *client = ostrel_client_create(NULL);
  ostrel_message *message = ostrel_message_create();
  ostrel_create_session(client, session, NULL, NULL);
  ostrel_start_session(client, session, NULL, NULL);
  ostrel_message_set_text(message, "route", "Speaker");
  ostrel_send_message(client, message, 0x40000007, 0, &session, 1, NULL, NULL);
  ostrel_stop_session(client, session, NULL, NULL);
  const bool isSent = ostrel_client_flush(client, 2000);
  ostrel_message_destroy(message);
  ostrel_client_destroy(client);
  return isSent ? 0 : 1;
}
