#pragma once
// Every command class of the protocol.

#include "protocol/cmd_table.h"
#include "protocol/config_data_cmds.h"
#include "protocol/pack_cmds.h"
#include "protocol/progress_cmds.h"
