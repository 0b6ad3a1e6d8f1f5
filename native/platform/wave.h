// Wave formats: WAVEFORMATEX, WAVEFORMATEXTENSIBLE, format tags, the PCM and float subtypes,
// speaker masks.
#pragma once

#include "platform/com.h"

#ifdef _WIN32
// mmreg.h alone carries the structures, the subtypes and the speaker masks; ksmedia.h here would
// clash with the Media Foundation headers that some sources include after this one.
#include <mmreg.h>
#else
#include "platform/linux/wave.h"
#endif

static_assert(sizeof(WAVEFORMATEX) == 18, "WAVEFORMATEX is 18 bytes");
static_assert(sizeof(WAVEFORMATEXTENSIBLE) == 40, "WAVEFORMATEXTENSIBLE is 40 bytes");
