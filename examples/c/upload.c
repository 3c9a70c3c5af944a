/* Files, log data and one-shot events from C.
 *
 * 1. A session asks the daemon to upload a file the process wrote. The
 *    framework opens the file here, with this process's rights, and hands
 *    the daemon the open descriptor: the daemon never opens a path itself.
 *    When the upload server took the file ("removeFile" true), the framework
 *    has deleted it by the time the answer arrives.
 * 2. The same session posts an array of log data.
 * 3. A second connection sends one event with a full session info, without
 *    a session of its own: the daemon makes the backends for that one event.
 *
 * Every answer is printed. "success": false means that no backend of this
 * client type takes files (the upload backend) or log data (the dashboard
 * backend), as on a device without a storebag; the example still succeeds. */
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>
#include <zerith/zerith.h>

/* One answer at a time: main makes a call, then waits for its callback,
 * which runs on a framework thread. */
static pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
static pthread_cond_t answered = PTHREAD_COND_INITIALIZER;
static int waiting, failed;

static void on_reply(void* step, const char* reply, const char* error) {
  pthread_mutex_lock(&lock);
  printf("%s: %s\n", (const char*)step, reply ? reply : error);
  failed |= reply == NULL;
  waiting = 0;
  pthread_cond_signal(&answered);
  pthread_mutex_unlock(&lock);
}

/* Waits for the answer of a call that was queued (`queued` 0), or says why
 * it was not. The framework calls every callback once, also when the
 * connection ends, so the wait ends. */
static int answer(int queued) {
  if (queued != 0) {
    fprintf(stderr, "upload: %s\n", zerith_last_error());
    return -1;
  }
  pthread_mutex_lock(&lock);
  while (waiting) pthread_cond_wait(&answered, &lock);
  pthread_mutex_unlock(&lock);
  return failed ? -1 : 0;
}

static zerith_session* open_session(void) {
  zerith_session* session = zerith_create(ZERITH_FORMAT_JSON);
  if (session != NULL && zerith_connect(session, NULL) != 0) { /* NULL: the default socket */
    fprintf(stderr, "upload: %s\n", zerith_last_error());
    zerith_destroy(session);
    session = NULL;
  }
  return session;
}

/* A small log file in a folder of its own; 0 when it was written. */
static int write_log(char* folder, char* path, size_t size) {
  if (mkdtemp(folder) == NULL) return -1;
  snprintf(path, size, "%s/session.log", folder);
  FILE* file = fopen(path, "w");
  if (file == NULL) return -1;
  for (int i = 0; i < 100; i++) fprintf(file, "frame %d rendered in %d ms\n", i, 10 + i % 7);
  return fclose(file);
}

int main(void) {
  const char* tmp = getenv("TMPDIR");
  char folder[4096], path[4200];
  snprintf(folder, sizeof folder, "%s/zerith-upload-XXXXXX", tmp != NULL && *tmp != '\0' ? tmp : "/tmp");
  if (write_log(folder, path, sizeof path) != 0) {
    perror("upload: cannot write the log file");
    return 1;
  }

  zerith_session* session = open_session();
  if (session == NULL) return 1;
  int rc = zerith_set_session_info(session, "{\"clientType\": 7, \"sessionID\": 1}", NULL, NULL, 0);
  waiting = 1;
  rc = rc != 0 ? -1 : answer(zerith_start_config(session, on_reply, "start"));

  /* A plain path or a file:// URL; the file's name travels with it. */
  waiting = 1;
  if (rc == 0) rc = answer(zerith_upload_file(session, path, NULL, on_reply, "upload file"));
  if (rc == 0) printf("the log file %s\n", access(path, F_OK) == 0 ? "is still here" : "was taken and removed");

  waiting = 1;
  if (rc == 0)
    rc = answer(zerith_upload_log_data(session, "[{\"level\": \"info\", \"text\": \"stream started\"}]", on_reply,
                                       "upload log data"));
  if (rc == 0 && zerith_finish_session(session) != 0) rc = answer(-1);
  zerith_destroy(session);

  /* A one-shot event: "finished" means it was handed to the backends,
   * "storebag not available" that the client type has none. */
  zerith_session* once = rc == 0 ? open_session() : NULL;
  if (once != NULL) {
    waiting = 1;
    rc = answer(zerith_send_message_with_session_info(once, "{\"clientType\": 7, \"sessionID\": 2}", NULL, 21, 1,
                                                      "{\"crashed\": false}", on_reply, "one-shot event"));
    zerith_destroy(once);
  } else {
    rc = -1;
  }

  unlink(path);
  rmdir(folder);
  return rc == 0 ? 0 : 1;
}
