#include "dbuskesttypes.h"

#include <QDBusMetaType>

void registerKestDBusTypes()
{
    // The names matter: moc records "UidList" in the slot signatures that QtDBus resolves.
    qRegisterMetaType<UidList>("UidList");
    qRegisterMetaType<SessionInfo>("SessionInfo");
    qRegisterMetaType<SessionList>("SessionList");
    qDBusRegisterMetaType<UidList>();
    qDBusRegisterMetaType<SessionInfo>();
    qDBusRegisterMetaType<SessionList>();
}
