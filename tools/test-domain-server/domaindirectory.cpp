#include "domaindirectory.h"

#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QSaveFile>

namespace
{
const QByteArray accountPath("/v3/account/");
const QByteArray authPath("/v1/auth/");
const QByteArray groupPath("/v3/group/");
const QByteArray resetPasswordPath("/v3/client/reset_password");
const QByteArray domainPath("/v1/domain/");

HttpResponse reply(int code, const QString &msg, const QJsonValue &data, int status = 200)
{
    const QJsonObject object { { QStringLiteral("code"), code }, { QStringLiteral("msg"), msg },
        { QStringLiteral("data"), data } };
    return HttpResponse { status, QJsonDocument(object).toJson(QJsonDocument::Compact) };
}

HttpResponse ok(const QJsonValue &data)
{
    return reply(0, QStringLiteral("ok"), data);
}

HttpResponse badRequest(const QString &msg)
{
    return reply(2, msg, QJsonValue::Null, 400);
}

// Names arrive as the machine knows them ("@alice"); the directory stores them without the "@".
QString directoryName(QString name)
{
    if (name.startsWith(QLatin1Char('@')))
        name.remove(0, 1);
    return name;
}

int indexOf(const QJsonArray &entries, const QString &key, const QJsonValue &value)
{
    for (int i = 0; i < entries.size(); ++i) {
        const QJsonValue candidate = entries.at(i).toObject().value(key);
        if (value.isString() ? candidate == value : candidate.toDouble(-1) == value.toDouble(-2))
            return i;
    }
    return -1;
}

QJsonObject publicUser(QJsonObject user)
{
    user.insert(QStringLiteral("password"), QStringLiteral("x"));
    return user;
}
} // namespace

DomainDirectory::DomainDirectory(const QString &dataFile)
    : m_dataFile(dataFile)
{
}

bool DomainDirectory::isReadable(QString &error) const
{
    QJsonObject data;
    if (load(data))
        return true;
    error = QStringLiteral("cannot read a JSON object from ") + m_dataFile;
    return false;
}

HttpResponse DomainDirectory::answer(const HttpRequest &request) const
{
    const QByteArray &path = request.path;
    const QByteArray wanted = path == authPath ? "POST" : path == resetPasswordPath ? "PATCH" : "GET";
    if (path != accountPath && path != authPath && path != groupPath && path != resetPasswordPath && path != domainPath)
        return reply(404, QStringLiteral("no such path"), QJsonValue::Null, 404);
    if (request.method != wanted)
        return reply(405, QStringLiteral("method not allowed"), QJsonValue::Null, 405);

    QJsonObject data;
    if (!load(data))
        return reply(500, QStringLiteral("data file unreadable"), QJsonValue::Null, 500);
    if (path == domainPath)
        return queryDomain(data);

    QJsonParseError error;
    const QJsonDocument document = QJsonDocument::fromJson(request.body, &error);
    if (error.error != QJsonParseError::NoError || !document.isObject())
        return badRequest(QStringLiteral("request body is not a JSON object"));
    const QJsonObject body = document.object();
    if (path == accountPath)
        return queryAccount(data, body);
    if (path == authPath)
        return authenticate(data, body);
    if (path == groupPath)
        return queryGroup(data, body);
    return resetPassword(data, body);
}

HttpResponse DomainDirectory::queryAccount(const QJsonObject &data, const QJsonObject &body) const
{
    const QJsonArray users = data.value(QLatin1String("users")).toArray();
    int index = -1;
    if (body.value(QLatin1String("username")).isString())
        index = indexOf(users, QStringLiteral("name"), directoryName(body.value(QLatin1String("username")).toString()));
    else if (body.value(QLatin1String("uid")).isDouble())
        index = indexOf(users, QStringLiteral("uid"), body.value(QLatin1String("uid")));
    else
        return badRequest(QStringLiteral("username or uid required"));
    if (index < 0)
        return reply(1, QStringLiteral("user not found"), QJsonValue::Null);
    return ok(QJsonObject { { QStringLiteral("user"), publicUser(users.at(index).toObject()) } });
}

HttpResponse DomainDirectory::authenticate(const QJsonObject &data, const QJsonObject &body) const
{
    const QJsonObject credentials = body.value(QLatin1String("data")).toObject();
    if (!credentials.value(QLatin1String("username")).isString()
        || !credentials.value(QLatin1String("password")).isString())
        return badRequest(QStringLiteral("data.username and data.password required"));
    const QJsonArray users = data.value(QLatin1String("users")).toArray();
    const QString name = directoryName(credentials.value(QLatin1String("username")).toString());
    const int index = indexOf(users, QStringLiteral("name"), name);
    const bool result = index >= 0
        && users.at(index).toObject().value(QLatin1String("password")) == credentials.value(QLatin1String("password"));
    return ok(QJsonObject { { QStringLiteral("result"), result } });
}

HttpResponse DomainDirectory::queryGroup(const QJsonObject &data, const QJsonObject &body) const
{
    const QJsonArray groups = data.value(QLatin1String("groups")).toArray();
    int index = -1;
    if (body.value(QLatin1String("groupname")).isString())
        index = indexOf(groups, QStringLiteral("name"), body.value(QLatin1String("groupname")));
    else if (body.value(QLatin1String("gid")).isDouble())
        index = indexOf(groups, QStringLiteral("gid"), body.value(QLatin1String("gid")));
    else
        return badRequest(QStringLiteral("groupname or gid required"));
    if (index < 0)
        return reply(1, QStringLiteral("group not found"), QJsonValue::Null);
    return ok(QJsonObject { { QStringLiteral("group"), groups.at(index) } });
}

HttpResponse DomainDirectory::resetPassword(QJsonObject data, const QJsonObject &body) const
{
    const QJsonValue password = body.value(QLatin1String("password"));
    const QJsonValue oldPassword = body.value(QLatin1String("old_password"));
    if (!body.value(QLatin1String("username")).isString() || !password.isString() || !oldPassword.isString())
        return badRequest(QStringLiteral("username, password and old_password required"));
    QJsonArray users = data.value(QLatin1String("users")).toArray();
    const QString name = directoryName(body.value(QLatin1String("username")).toString());
    const int index = indexOf(users, QStringLiteral("name"), name);
    if (index < 0)
        return reply(1, QStringLiteral("user not found"), QJsonValue::Null);
    QJsonObject user = users.at(index).toObject();
    // A uid, when sent, must be the user's own: the client takes it from its local list.
    if (body.contains(QLatin1String("uid"))
        && body.value(QLatin1String("uid")).toDouble(-1) != user.value(QLatin1String("uid")).toDouble(-2))
        return reply(1, QStringLiteral("user not found"), QJsonValue::Null);
    if (user.value(QLatin1String("password")) != oldPassword)
        return reply(1, QStringLiteral("old password is wrong"), QJsonValue::Null);

    user.insert(QStringLiteral("password"), password);
    users.replace(index, user);
    data.insert(QStringLiteral("users"), users);
    if (!save(data))
        return reply(500, QStringLiteral("data file not writable"), QJsonValue::Null, 500);
    return ok(QJsonValue::Null);
}

HttpResponse DomainDirectory::queryDomain(const QJsonObject &data) const
{
    const QString domain = data.value(QLatin1String("domain")).toString(QStringLiteral("kest.test"));
    return ok(QJsonObject { { QStringLiteral("domain"), domain } });
}

bool DomainDirectory::load(QJsonObject &data) const
{
    QFile file(m_dataFile);
    if (!file.open(QIODevice::ReadOnly))
        return false;
    const QJsonDocument document = QJsonDocument::fromJson(file.readAll());
    data = document.object();
    return document.isObject();
}

bool DomainDirectory::save(const QJsonObject &data) const
{
    QSaveFile file(m_dataFile);
    if (!file.open(QIODevice::WriteOnly))
        return false;
    file.write(QJsonDocument(data).toJson(QJsonDocument::Indented));
    return file.commit();
}
