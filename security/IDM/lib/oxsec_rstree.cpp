// Placeholder; the module arrives with its issue.
#include "oxidm_internal.h"
