#include "pm/task/buffers.h"
