#include "utils/file_util.h"

// Implemented in the utilities work; see file_util.h for the contract.
