/* Everything the host offers the module. */
#pragma once

#include "platform/orr_base.h"
#include "platform/orr_hash.h"
#include "platform/orr_heap.h"
#include "platform/orr_lock.h"
#include "platform/orr_log.h"
#include "platform/orr_module.h"
#include "platform/orr_nexo.h"
#include "platform/orr_pkt.h"
#include "platform/orr_plex.h"
#include "platform/orr_portset.h"
#include "platform/orr_sifra.h"
#include "platform/orr_text.h"
#include "platform/orr_time.h"
