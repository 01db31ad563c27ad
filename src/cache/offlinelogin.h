#pragma once

#include <QString>

// Whether the account may log in against its cache record while the domain server cannot be asked. knownUid is
// where the caller's user list has the account, 0 when it has none.
bool checkOfflineLogin(const QString &account, quint32 knownUid = 0);
