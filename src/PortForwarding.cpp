#include "PortForwarding.h"
