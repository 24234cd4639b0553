/* Umbrella header of the appliance platform layer. */
#ifndef KYTOPLATFORM_KYTOPLATFORM_H
#define KYTOPLATFORM_KYTOPLATFORM_H

#include "kyto_errors.h"
#include "klibc.h"
#include "kyto_system.h"
#include "kytoconf.h"

#endif
