#include "compactjson.h"

namespace
{
char hexDigit(uint value)
{
    return "0123456789abcdef"[value & 0xf];
}

void appendUnicodeEscape(QByteArray &out, uint unit)
{
    out += "\\u";
    for (int shift = 12; shift >= 0; shift -= 4)
        out += hexDigit(unit >> shift);
}

void appendAscii(QByteArray &out, char16_t unit)
{
    switch (unit) {
    case u'"':
        out += "\\\"";
        return;
    case u'\\':
        out += "\\\\";
        return;
    case u'\b':
        out += "\\b";
        return;
    case u'\f':
        out += "\\f";
        return;
    case u'\n':
        out += "\\n";
        return;
    case u'\r':
        out += "\\r";
        return;
    case u'\t':
        out += "\\t";
        return;
    }
    if (unit < 0x20)
        appendUnicodeEscape(out, unit);
    else
        out += char(unit);
}

void appendUtf8(QByteArray &out, uint code)
{
    if (code < 0x800) {
        out += char(0xc0 | (code >> 6));
    } else if (code < 0x10000) {
        out += char(0xe0 | (code >> 12));
        out += char(0x80 | ((code >> 6) & 0x3f));
    } else {
        out += char(0xf0 | (code >> 18));
        out += char(0x80 | ((code >> 12) & 0x3f));
        out += char(0x80 | ((code >> 6) & 0x3f));
    }
    out += char(0x80 | (code & 0x3f));
}
} // namespace

QByteArray CompactJson::string(const QString &text)
{
    QByteArray out;
    out.reserve(text.size() + 2);
    out += '"';
    const QChar *const end = text.constEnd();
    for (const QChar *c = text.constBegin(); c != end; ++c) {
        const char16_t unit = c->unicode();
        if (unit < 0x80) {
            appendAscii(out, unit);
        } else if (c->isHighSurrogate() && c + 1 != end && c[1].isLowSurrogate()) {
            appendUtf8(out, QChar::surrogateToUcs4(*c, c[1]));
            ++c;
        } else if (c->isSurrogate()) {
            // A surrogate without its other half has no UTF-8 form.
            appendUnicodeEscape(out, unit);
        } else {
            appendUtf8(out, unit);
        }
    }
    out += '"';
    return out;
}
