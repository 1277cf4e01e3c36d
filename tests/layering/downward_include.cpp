// Must compile: a layer including the layers below it and itself.
#include "core/Log.h"
#include "discovery/SsdpDeviceManager.h"
#include "platform/SystemInfo.h"
