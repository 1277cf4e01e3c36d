// Calls the self-restart from a process of its own; exits 3 if the restart returned.
#include "core/Process.h"

int main() {
    kesu::process::restartService();
    return 3;
}
