#include "pm/ipc/connection.h"
