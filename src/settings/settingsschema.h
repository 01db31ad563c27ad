#pragma once

#include <QList>
#include <QString>
#include <QVariant>

// Every group and key the settings file may hold, with the type and range the daemons read it as.
// The one list that the configuration check, the daemon's start-up and the documentation follow.
class SettingsSchema
{
public:
    enum class Type {
        Text,
        Bool,
        Int, // a whole number within minimum..maximum
        AuthorityFile, // PEM certificates that verify the domain server
        CertificateFile, // PEM client certificate chain
        KeyFile, // PEM RSA private key of the client certificate
    };

    struct Key {
        const char *group;
        const char *name;
        Type type;
        int minimum;
        int maximum;
        // Part of the password policy that the domain server sends and the desktop reads.
        bool policy = false;
    };

    static const Key *find(const QString &group, const QString &name);
    static QList<const Key *> policyKeys();
    static bool isKnownGroup(const QString &group);
    // The known key closest in spelling, as "[group] key"; keys of the given group win a tie.
    static QString nearestKey(const QString &group, const QString &name);
    // The known group closest in spelling.
    static QString nearestGroup(const QString &group);
    // Empty when the value, as the settings reader returns it, is of the key's type and range; else what is wrong.
    static QString valueProblem(const Key &key, const QVariant &value);
    // The daemon's own port value, or 0 (and the reason) when it is not one.
    static int portValue(const QVariant &value, QString *problem = nullptr);
};
