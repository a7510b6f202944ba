#include "Statistics/Service/ServiceMain.h"
#include "linux/Service.h"
#include "platform/Process.h"

int main() {
  quarvel::Service service;
  // Commits the store's rows and writes the log out; no destructor runs while a client's work still
  // holds a thread.
  quarvel::ExitProcess(quarvel::ServiceMain());
}
