#include "RouterRuleServHandler.h"
