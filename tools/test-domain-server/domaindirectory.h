#pragma once

#include "httpmessage.h"

#include <QJsonObject>
#include <QString>

// The accounts of the test domain server and its REST answers. The data file is read on every
// request, so edits apply at once; password changes are written back to it.
class DomainDirectory
{
public:
    explicit DomainDirectory(const QString &dataFile);

    // Checks that the data file holds a JSON object; the server refuses to start otherwise.
    bool isReadable(QString &error) const;
    HttpResponse answer(const HttpRequest &request) const;

private:
    HttpResponse queryAccount(const QJsonObject &data, const QJsonObject &body) const;
    HttpResponse authenticate(const QJsonObject &data, const QJsonObject &body) const;
    HttpResponse queryGroup(const QJsonObject &data, const QJsonObject &body) const;
    HttpResponse resetPassword(QJsonObject data, const QJsonObject &body) const;
    HttpResponse queryDomain(const QJsonObject &data) const;

    bool load(QJsonObject &data) const;
    bool save(const QJsonObject &data) const;

    QString m_dataFile;
};
