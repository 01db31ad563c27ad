#include "clientcredentials.h"

#include <QFile>
#include <QFileInfo>

namespace
{
// One DER element: its tag and where its contents lie. False when the bytes do not hold one.
bool derElement(const QByteArray &der, int offset, char &tag, int &contentStart, int &contentLength)
{
    if (offset + 2 > der.size())
        return false;
    tag = der.at(offset);
    const auto first = quint8(der.at(offset + 1));
    int position = offset + 2;
    if (first < 0x80) {
        contentLength = first;
    } else {
        const int lengthBytes = first & 0x7f;
        if (lengthBytes == 0 || lengthBytes > 3 || position + lengthBytes > der.size())
            return false;
        contentLength = 0;
        for (int i = 0; i < lengthBytes; ++i)
            contentLength = (contentLength << 8) | quint8(der.at(position++));
    }
    contentStart = position;
    return contentStart + contentLength <= der.size();
}

// The modulus of an RSA private key in its PKCS#1 form: the second integer of the outer sequence.
QByteArray rsaModulus(const QByteArray &privateDer)
{
    char tag = 0;
    int start = 0, length = 0;
    if (!derElement(privateDer, 0, tag, start, length) || tag != 0x30)
        return QByteArray();
    int versionStart = 0, versionLength = 0;
    if (!derElement(privateDer, start, tag, versionStart, versionLength) || tag != 0x02)
        return QByteArray();
    if (!derElement(privateDer, versionStart + versionLength, tag, start, length) || tag != 0x02)
        return QByteArray();
    return privateDer.mid(start, length);
}
} // namespace

QString ClientCredentials::unreadableReason(const QString &path)
{
    if (path.isEmpty())
        return QStringLiteral("not set");
    const QFileInfo info(path);
    if (!info.exists())
        return QStringLiteral("missing");
    if (!info.isFile())
        return QStringLiteral("not a file");
    QFile file(path);
    if (!file.open(QIODevice::ReadOnly))
        return QStringLiteral("unreadable: ") + file.errorString();
    return QString();
}

bool ClientCredentials::keyMatches(const QSslKey &key, const QSslCertificate &certificate)
{
    const QByteArray modulus = rsaModulus(key.toDer());
    // The certificate's public key holds the same modulus, whatever wrapping Qt's encoding adds around it.
    return modulus.size() >= 64 && certificate.publicKey().toDer().contains(modulus);
}

void ClientCredentials::fail(const QString &path, const QString &what)
{
    if (!m_problem.isEmpty())
        return;
    m_faultyPath = path;
    m_problem = what + QStringLiteral(": ") + (path.isEmpty() ? QStringLiteral("(not set)") : path);
}

ClientCredentials ClientCredentials::load(const QString &chainPath, const QString &keyPath)
{
    ClientCredentials credentials;
    QString reason = unreadableReason(chainPath);
    if (!reason.isEmpty()) {
        credentials.fail(chainPath, QStringLiteral("client certificate file ") + reason);
    } else {
        QFile file(chainPath);
        file.open(QIODevice::ReadOnly);
        credentials.m_chain = QSslCertificate::fromData(file.readAll(), QSsl::Pem);
        if (credentials.m_chain.isEmpty())
            credentials.fail(chainPath, QStringLiteral("client certificate file holds no PEM certificate"));
    }
    reason = unreadableReason(keyPath);
    if (!reason.isEmpty()) {
        credentials.fail(keyPath, QStringLiteral("client private key file ") + reason);
        return credentials;
    }
    QFile file(keyPath);
    file.open(QIODevice::ReadOnly);
    credentials.m_key = QSslKey(&file, QSsl::Rsa, QSsl::Pem, QSsl::PrivateKey);
    if (credentials.m_key.isNull())
        credentials.fail(keyPath, QStringLiteral("client private key file holds no PEM RSA private key"));
    else if (!credentials.m_chain.isEmpty() && !keyMatches(credentials.m_key, credentials.m_chain.first()))
        credentials.fail(keyPath, QStringLiteral("client private key does not match the certificate ") + chainPath);
    return credentials;
}
