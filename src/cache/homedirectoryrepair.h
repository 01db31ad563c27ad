#pragma once

#include <QString>

class UserListManager;

// Gives a network user's home directory back to the user after an online login.
class HomeDirectoryRepair
{
public:
    static void repair(const QString &userName, const UserListManager &users);

private:
    static void walk(const QString &home, uint uid, const QString &userName);
};
