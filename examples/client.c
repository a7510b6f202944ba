/* A program with its own event loop reports a session: the library makes no thread, no call waits.
 *
 * Usage: client-c [SOCKET]    (else $QUARVEL_SOCKET, else where the service listens by default) */

#include <errno.h>
#include <inttypes.h>
#include <quarvel/quarvel.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/epoll.h>
#include <sys/random.h>
#include <sys/timerfd.h>
#include <unistd.h>

enum { MESSAGES = 5, MESSAGE_INTERVAL_MS = 50 };

typedef struct {
  quarvel_client* client;
  quarvel_payload* payload;
  int64_t session;
  int sent;
  bool ended;
  int status;
} program;

static void fail(program* self, const char* what, const char* why) {
  fprintf(stderr, "%s: %s\n", what, why);
  self->status = EXIT_FAILURE;
  self->ended = true;
}

/* The reply to the start, which comes when the session stops. */
static void stopped(void* context, bool result, const quarvel_error* error) {
  program* self = context;
  (void)result;
  if (error != NULL) {
    fail(self, "start", error->reason);
  } else {
    printf("session %" PRId64 " has stopped\n", self->session);
    self->ended = true;
  }
}

static void routed(void* context, const quarvel_error* error) {
  if (error != NULL) fail(context, "message", error->reason);
}

static void connection_changed(void* context, const quarvel_connection_change* change) {
  (void)context;
  if (change->restored) {
    fprintf(stderr, "the service is back, with %" PRIu64 " sessions made anew\n", change->sessions);
  } else {
    fprintf(stderr, "%s\n", change->reason);
  }
}

static void begin(program* self) {
  quarvel_client* client = self->client;
  quarvel_create_reporting_session(client, self->session, NULL, NULL);
  quarvel_set_service_type(client, QUARVEL_SERVICE_LONG_FORM_AUDIO, self->session, NULL, NULL);
  quarvel_payload_clear(self->payload);
  quarvel_payload_string(self->payload, "HostApplicationDisplayID", "org.example.player");
  quarvel_set_configuration(client, self->payload, self->session, NULL, NULL);
  quarvel_start_reporting_session_for_id(client, self->session, stopped, self);
}

/* Each time that the timer has run out. */
static void tick(program* self) {
  quarvel_status status;
  if (self->sent == MESSAGES) {
    quarvel_stop_reporting_session_for_id(self->client, self->session, NULL, NULL);
    return;
  }
  quarvel_payload_clear(self->payload);
  quarvel_payload_integer(self->payload, "number", ++self->sent);
  quarvel_payload_string(self->payload, "route", "Speaker");
  quarvel_payload_open_list(self->payload, "rates");
  quarvel_payload_integer(self->payload, NULL, 44100);
  quarvel_payload_integer(self->payload, NULL, 48000);
  quarvel_payload_close(self->payload);
  status = quarvel_send_message(self->client, self->payload,
                                QUARVEL_COMPONENT_ROUTING + QUARVEL_KIND_ROUTE_CHANGE,
                                QUARVEL_TYPE_START, &self->session, 1, routed, self);
  if (status != QUARVEL_OK) fprintf(stderr, "message: %s\n", quarvel_status_text(status));
}

static int watch(int epoll, int descriptor) {
  struct epoll_event event = {.events = EPOLLIN, .data.fd = descriptor};
  return epoll_ctl(epoll, EPOLL_CTL_ADD, descriptor, &event);
}

static int start_timer(void) {
  const struct timespec interval = {0, MESSAGE_INTERVAL_MS * 1000000L};
  const struct itimerspec when = {interval, interval};
  const int timer = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC);
  if (timer >= 0) timerfd_settime(timer, 0, &when, NULL);
  return timer;
}

int main(int argc, char** argv) {
  program self = {.status = EXIT_SUCCESS};
  const quarvel_options options = {
      .size = sizeof options,
      .socket_path = argc > 1 ? argv[1] : NULL,
      .driver = QUARVEL_CALLER,
      .reconnect = true,
      .connection_changed = connection_changed,
  };
  quarvel_error error;
  const int epoll = epoll_create1(EPOLL_CLOEXEC);
  const int timer = start_timer();

  /* All clients share one space of ids; 0 is none. */
  if (getrandom(&self.session, sizeof self.session, 0) != sizeof self.session) return EXIT_FAILURE;
  self.session |= 1;
  self.payload = quarvel_payload_new();
  if (quarvel_client_new(&options, &self.client, &error) != QUARVEL_OK) {
    fprintf(stderr, "%s\n", error.reason);
    return EXIT_FAILURE;
  }
  if (watch(epoll, quarvel_descriptor(self.client)) != 0 || watch(epoll, timer) != 0) {
    perror("epoll");
    return EXIT_FAILURE;
  }

  begin(&self);
  while (!self.ended) {
    struct epoll_event due;
    uint64_t ticks;
    if (epoll_wait(epoll, &due, 1, -1) != 1) continue;
    if (due.data.fd != timer) {
      quarvel_dispatch(self.client, 0);
    } else if (read(timer, &ticks, sizeof ticks) == sizeof ticks) {
      tick(&self);
    }
  }

  close(epoll);
  close(timer);
  quarvel_client_free(self.client);
  quarvel_payload_free(self.payload);
  return self.status;
}
