#include "pm/task/formats.h"
