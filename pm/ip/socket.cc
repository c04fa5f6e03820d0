#include "pm/ip/socket.h"
