#include "StatusReportor.h"
