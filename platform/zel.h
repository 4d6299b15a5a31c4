// The host kernel interface as the module uses it. The module includes this
// header and nothing else of the host.
#pragma once

#include "platform/zel_chardev.h"
#include "platform/zel_hash.h"
#include "platform/zel_kernel.h"
#include "platform/zel_list.h"
#include "platform/zel_pkt.h"
#include "platform/zel_qry.h"
#include "platform/zel_sluice.h"
#include "platform/zel_status.h"
