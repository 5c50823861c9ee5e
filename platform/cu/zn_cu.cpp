#include "zn_cu.h"
