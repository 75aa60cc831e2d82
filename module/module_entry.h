/*
 * The entry points the host loader calls: init_module returns 0 when the
 * module is ready and 1 on any failure, having released what it made;
 * cleanup_module returns the status of the framework teardown.
 */
#pragma once

#include "platform/orr_base.h"

ORR_MODULE_EXPORT int init_module(void);
ORR_MODULE_EXPORT orr_Status cleanup_module(void);

/*
 * The same two functions under names that are bound inside the image. The
 * module information must point at these: the C library has an
 * init_module of its own, and a reference to the exported name can be
 * resolved to it by the loader.
 */
extern "C" __attribute__((visibility("hidden"))) int sifraGenericInitModule(void);
extern "C" __attribute__((visibility("hidden"))) orr_Status sifraGenericCleanupModule(void);
