#pragma once

#include <QString>

// Whether the account may log in against its cache record while the domain server cannot be asked.
bool checkOfflineLogin(const QString &account);
