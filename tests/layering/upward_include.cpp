// Must not compile: the bottom layer reaching up into discovery.
#include "core/Log.h"
#include "discovery/SsdpDeviceManager.h"
