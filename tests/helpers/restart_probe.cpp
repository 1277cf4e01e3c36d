// Calls the self-restart from a process of its own; exits 3 if the restart returned.
#include "core/Utils.h"

int main() {
    kesu::Utils::restartService();
    return 3;
}
