/*
 * Test hooks of the exported port database queries: while on, every port
 * database change message makes the module read that port's database
 * through its own exported functions. Off after module start.
 */
#pragma once

#include "platform/orr_lock.h"
#include "platform/orr_portset.h"

#define SWSEC_TEST_CONFIG_LOCK_NAME "sifg.sec.testConfig"

/* "sifg.sec.testConfig", reader-writer, rank 7: guards cbHandle. */
extern orr_Spinlock testConfigLock;
/* The message callback registration; 0 while the hooks are off. */
extern orr_PortsetMessageCBHandle cbHandle;

/* Makes the lock, hooks off. */
orr_Status SwSecTestsInit(void);
/* Switches the hooks off and destroys the lock; ORR_OK. */
orr_Status SwSecTestsCleanup(void);
/*
 * Switches the hooks on: registers SwSecPortDbTestMsgCb for port database
 * messages on every portset. ORR_OK when already on; else the
 * registration's status (the hooks stay off on a failure).
 */
orr_Status SwSecPortDbTestStart(void);
/* Switches the hooks off; ORR_OK whether they were on or not. */
orr_Status SwSecPortDbTestStop(void);
/*
 * A port database change message: reads the port's database through the
 * exported queries, for each selector, and gives the buffers back. Runs
 * where the portset delivers messages, after the poster let go of the
 * port's configLock (the host queues deliveries until then); it takes that
 * lock shared through the queries and never takes testConfigLock.
 */
void SwSecPortDbTestMsgCb(uint32_t portId, uint64_t msgClass, const orr_PortsetMessageHeader *message);
