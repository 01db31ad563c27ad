#pragma once

#include <QByteArray>
#include <QString>

// JSON text of a string written directly, byte for byte what QJsonDocument writes for it: the replies
// sent at every look-up are cheaper to write than to build as a document first.
class CompactJson
{
public:
    // Appends the quoted and escaped text.
    static void append(QByteArray &out, const QString &text);
};
