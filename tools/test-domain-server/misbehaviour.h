#pragma once

#include <QByteArray>
#include <QString>

// What the server does instead of answering normally, as the behaviour file asks for one path.
class Misbehaviour
{
public:
    enum class Kind {
        None,
        NotJson, // status 200, a body that is not JSON; the request is not carried out
        NoMsg, // status 200, a JSON object without "msg"; the request is not carried out
        Status, // the normal answer's body with another status
        Delay, // the normal answer, sent late
        Close, // the connection is closed without an answer; the request is not carried out
        Redirect, // status 302 to another path of this server; the request is not carried out
    };

    // The behaviour file maps request paths, or "*" for every other path, to a behaviour text.
    // It is read afresh on every request; a missing or empty file name means no misbehaviour.
    static Misbehaviour forPath(const QString &behaviourFile, const QByteArray &path);
    static Misbehaviour parse(const QString &text);

    Kind kind() const { return m_kind; }
    // The status of Status, the milliseconds of Delay.
    int value() const { return m_value; }
    // The path of Redirect.
    QByteArray target() const { return m_target; }

private:
    Kind m_kind = Kind::None;
    int m_value = 0;
    QByteArray m_target;
};
