#include "utils/json_util.h"
