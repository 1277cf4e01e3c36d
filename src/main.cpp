#include "core/ServiceMain.h"

int main() { return kesu::runService(); }
