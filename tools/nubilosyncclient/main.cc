// nubilosyncclient: the sync client people run.
#include "client/cli/Commands.h"

int main(int argc, char** argv) {
  return vtc::client::runCommandLine(argc, argv);
}
