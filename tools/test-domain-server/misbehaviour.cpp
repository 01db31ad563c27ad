#include "misbehaviour.h"

#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>
#include <QTextStream>

Misbehaviour Misbehaviour::forPath(const QString &behaviourFile, const QByteArray &path)
{
    if (behaviourFile.isEmpty())
        return Misbehaviour();
    QFile file(behaviourFile);
    if (!file.open(QIODevice::ReadOnly))
        return Misbehaviour();
    const QJsonObject paths = QJsonDocument::fromJson(file.readAll()).object();
    const QString key = QString::fromUtf8(path);
    const QJsonValue text = paths.contains(key) ? paths.value(key) : paths.value(QLatin1String("*"));
    return parse(text.toString());
}

Misbehaviour Misbehaviour::parse(const QString &text)
{
    Misbehaviour behaviour;
    if (text.isEmpty())
        return behaviour;
    if (text == QLatin1String("not-json")) {
        behaviour.m_kind = Kind::NotJson;
        return behaviour;
    }
    if (text == QLatin1String("no-msg")) {
        behaviour.m_kind = Kind::NoMsg;
        return behaviour;
    }
    if (text == QLatin1String("close")) {
        behaviour.m_kind = Kind::Close;
        return behaviour;
    }
    const int colon = text.indexOf(QLatin1Char(':'));
    if (colon > 0 && text.left(colon) == QLatin1String("redirect") && text.mid(colon + 1).startsWith(QLatin1Char('/'))) {
        behaviour.m_kind = Kind::Redirect;
        behaviour.m_target = text.mid(colon + 1).toUtf8();
        return behaviour;
    }
    bool ok = false;
    const int value = text.mid(colon + 1).toInt(&ok);
    const QString name = text.left(colon);
    if (colon > 0 && ok && name == QLatin1String("status") && value >= 100 && value <= 599) {
        behaviour.m_kind = Kind::Status;
        behaviour.m_value = value;
        return behaviour;
    }
    if (colon > 0 && ok && name == QLatin1String("delay") && value >= 0) {
        behaviour.m_kind = Kind::Delay;
        behaviour.m_value = value;
        return behaviour;
    }
    QTextStream(stderr) << "unknown behaviour ignored: " << text << Qt::endl;
    return behaviour;
}
