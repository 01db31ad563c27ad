#pragma once

#include "cachecontrolinterface.h"

// A new record of the current format, in its constructed state.
CacheControlPtr createCacheControl();
// A new record of the given format version; an empty pointer for a version that does not exist.
CacheControlPtr createCacheControl(quint32 version);

// The record format version announced by a JSON text or an open record file (read without consuming
// it); 0 when none is recognised.
quint32 cacheVersionOfJson(const QString &json);
quint32 cacheVersionOfDevice(QIODevice &device);

// How long after the last login a record stays usable, from the settings' offline_login/cache_validity
// (days). Computed in 32-bit unsigned arithmetic, so very large day counts wrap.
quint32 cacheValiditySeconds();
