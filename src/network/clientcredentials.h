#pragma once

#include <QList>
#include <QSslCertificate>
#include <QSslKey>
#include <QString>

// This machine's client certificate chain and RSA key as the domain client sends them, with what
// makes them unusable: a missing or unreadable file, a file holding something else, a key that
// does not belong to the certificate. One reason at a time, naming the file at fault.
class ClientCredentials
{
public:
    static ClientCredentials load(const QString &chainPath, const QString &keyPath);

    bool isUsable() const { return m_problem.isEmpty(); }
    QString problem() const { return m_problem; }
    // The path the problem is about (empty when usable).
    QString faultyPath() const { return m_faultyPath; }
    const QList<QSslCertificate> &chain() const { return m_chain; }
    const QSslKey &key() const { return m_key; }

    // Why a file cannot be read, in words; empty when it can.
    static QString unreadableReason(const QString &path);
    // Whether the private key is the one the certificate carries the public half of.
    static bool keyMatches(const QSslKey &key, const QSslCertificate &certificate);

private:
    void fail(const QString &path, const QString &what);

    QList<QSslCertificate> m_chain;
    QSslKey m_key;
    QString m_problem;
    QString m_faultyPath;
};
