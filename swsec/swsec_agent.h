/* The switch-security agent's callbacks, run by every agent of the module. */
#pragma once

#include "framework/sifra_generic_agent.h"

extern const SifraGenericAgentOps sifraGenericFwFastPathOps;
