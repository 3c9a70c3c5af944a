/* A reporting session from C: connect, describe the session, start it, send
 * a few events and finish. The callbacks run on a framework thread: main
 * waits for each answer it needs under a mutex. */
#include <pthread.h>
#include <stdio.h>
#include <zerith/zerith.h>

static pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
static pthread_cond_t answered = PTHREAD_COND_INITIALIZER;
static int pending, failed;

static void on_reply(void* what, const char* reply, const char* error) {
  pthread_mutex_lock(&lock);
  printf("%s: %s\n", (const char*)what, reply ? reply : error);
  failed |= reply == NULL;
  pending--;
  pthread_cond_signal(&answered);
  pthread_mutex_unlock(&lock);
}

int main(void) {
  zerith_session* session = zerith_create(ZERITH_FORMAT_JSON);
  if (session == NULL) return 1;
  if (zerith_connect(session, NULL) != 0) { /* NULL: the default socket */
    fprintf(stderr, "report: %s\n", zerith_last_error());
    zerith_destroy(session);
    return 1;
  }
  pending = 4;
  int calls = zerith_set_session_info(session, "{\"clientType\": 7, \"sessionID\": 1}", NULL, NULL, 0) |
              zerith_start_config(session, on_reply, "start");
  for (int i = 0; i < 3; i++) {
    char event[96];
    snprintf(event, sizeof event, "{\"category\": 1, \"type\": 2, \"payload\": {\"n\": %d}}", i);
    calls |= zerith_send_message(session, event, on_reply, "send");
  }
  pthread_mutex_lock(&lock);
  while (calls == 0 && pending > 0) pthread_cond_wait(&answered, &lock);
  pthread_mutex_unlock(&lock);
  calls |= zerith_finish_session(session);
  if (calls != 0) fprintf(stderr, "report: %s\n", zerith_last_error());
  zerith_destroy(session);
  return calls != 0 || failed;
}
