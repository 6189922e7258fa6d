// zlkad: the process entry. Everything after start-up runs on the listener's loop and the queues.
#include <malloc.h>
#include <unistd.h>

#include "platform/listener/listener.h"
#include "service/daemon_setup.h"
#include "service/service_delegate.h"

int main(int argc, char** argv) {
  // One heap for all threads: a per-thread arena keeps its own high-water mark, and a daemon that
  // mostly waits on the network gains nothing from allocating in parallel.
  mallopt(M_ARENA_MAX, 1);
  // Before any thread exists, so that every thread inherits the mask and the loop gets the signals.
  platform::Listener::blockSignals();
  if (std::optional<int> status = setUpDaemon(argc, argv)) return *status;

  auto delegate = std::make_shared<ServiceDelegate>();
  platform::Listener& listener = platform::Listener::serviceListener();
  listener.setDelegate(delegate);
  int status = listener.resume();
  // Calls still blocked after the drain limit were answered already; do not wait for them.
  if (listener.callsInFlight() > 0) _exit(status);
  listener.setDelegate(nullptr);
  delegate.reset();
  return status;
}
