#include "app/ServiceMain.h"

int main() { return kesu::runService(); }
