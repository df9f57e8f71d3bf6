#include "ZARK.Core.PortForwarding.h"
