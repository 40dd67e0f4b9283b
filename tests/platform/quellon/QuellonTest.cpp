// The XML converter: tree shape, list handling, and refusal of malformed or hostile input.
#include "Quellon.h"

#include <gtest/gtest.h>

namespace {

QVariantMap parseMap(const QString& xml)
{
    Quellon quellon;
    const QVariant tree = quellon.parse(xml);
    EXPECT_TRUE(tree.isValid()) << qPrintable(xml);
    return tree.toMap();
}

bool isRefused(const QString& xml)
{
    Quellon quellon;
    return !quellon.parse(xml).isValid();
}

} // namespace

TEST(Quellon, RootIsTopKeyChildrenAreNestedMapsLeavesAreText)
{
    const QVariantMap root = parseMap(QStringLiteral("<A><B><C>x</C><D>7</D></B><E>y</E></A>"));
    ASSERT_EQ(root.keys(), QStringList{QStringLiteral("A")});
    const QVariantMap a = root.value(QStringLiteral("A")).toMap();
    EXPECT_EQ(a.value(QStringLiteral("E")), QVariant(QStringLiteral("y")));
    const QVariantMap b = a.value(QStringLiteral("B")).toMap();
    EXPECT_EQ(b.value(QStringLiteral("C")).toString(), QStringLiteral("x"));
    EXPECT_EQ(b.value(QStringLiteral("D")).toInt(), 7);
}

TEST(Quellon, RepeatedElementsBecomeListInDocumentOrderSingleStaysValue)
{
    const QVariantMap root = parseMap(QStringLiteral("<L><I>1</I><J>only</J><I>2</I><I><K>3</K></I></L>"));
    const QVariantMap l = root.value(QStringLiteral("L")).toMap();
    const QVariant items = l.value(QStringLiteral("I"));
    ASSERT_EQ(items.typeId(), QMetaType::QVariantList);
    const QVariantList list = items.toList();
    ASSERT_EQ(list.size(), 3);
    EXPECT_EQ(list.at(0).toString(), QStringLiteral("1"));
    EXPECT_EQ(list.at(1).toString(), QStringLiteral("2"));
    EXPECT_EQ(list.at(2).toMap().value(QStringLiteral("K")).toString(), QStringLiteral("3"));
    EXPECT_EQ(l.value(QStringLiteral("J")).typeId(), QMetaType::QString);
}

TEST(Quellon, ManyDistinctChildNamesKeepTheirOccurrences)
{
    // Past a handful of names the children are found by hash; both paths must agree.
    QString xml = QStringLiteral("<R>");
    for (int round = 0; round < 3; ++round) {
        for (int i = 0; i < 40; ++i) {
            if (round == 0 || i % 2 == 0) {
                xml += QStringLiteral("<N%1>%2</N%1>").arg(i).arg(round);
            }
        }
    }
    xml += QStringLiteral("</R>");
    const QVariantMap r = parseMap(xml).value(QStringLiteral("R")).toMap();
    ASSERT_EQ(r.size(), 40);
    for (int i = 0; i < 40; ++i) {
        const QVariant value = r.value(QStringLiteral("N%1").arg(i));
        if (i % 2 == 0) {
            EXPECT_EQ(value.toList(),
                      (QVariantList{QStringLiteral("0"), QStringLiteral("1"), QStringLiteral("2")}))
                << i;
        } else {
            EXPECT_EQ(value, QVariant(QStringLiteral("0"))) << i;
        }
    }
}

TEST(Quellon, EmptyElementsWhitespaceCdataAndEscapes)
{
    const QVariantMap root =
        parseMap(QStringLiteral("<?xml version=\"1.0\"?>\n<R attr=\"ignored\">\n  <Empty/>\n  <Open></Open>\n"
                                "  <Text>a &amp; b &lt;c&gt; &#x41;</Text>\n  <!-- comment -->\n  "
                                "<Data><![CDATA[<raw & text>]]></Data>\n"
                                "  <Spaces>  kept  </Spaces>\n</R>\n"));
    const QVariantMap r = root.value(QStringLiteral("R")).toMap();
    EXPECT_EQ(r.size(), 5); // indentation between children is not a child
    EXPECT_EQ(r.value(QStringLiteral("Empty")), QVariant(QString()));
    EXPECT_TRUE(r.value(QStringLiteral("Empty")).isValid());
    EXPECT_EQ(r.value(QStringLiteral("Open")).toString(), QString());
    EXPECT_EQ(r.value(QStringLiteral("Text")).toString(), QStringLiteral("a & b <c> A"));
    EXPECT_EQ(r.value(QStringLiteral("Data")).toString(), QStringLiteral("<raw & text>"));
    EXPECT_EQ(r.value(QStringLiteral("Spaces")).toString(), QStringLiteral("  kept  "));
    // A root without children is its text.
    EXPECT_EQ(parseMap(QStringLiteral("<Only>t</Only>")).value(QStringLiteral("Only")).toString(),
              QStringLiteral("t"));
}

TEST(Quellon, NonAsciiTextSurvives)
{
    const QString plate = QString::fromUtf8("京A·12345 Ä ß");
    const QVariantMap root = parseMap(QStringLiteral("<P>%1</P>").arg(plate));
    EXPECT_EQ(root.value(QStringLiteral("P")).toString(), plate);
}

TEST(Quellon, MalformedOrTruncatedInputIsInvalid)
{
    const QStringList bad = {
        QString(),
        QStringLiteral("   "),
        QStringLiteral("plain text"),
        QStringLiteral("<A>"),
        QStringLiteral("<A><B>x</B>"),
        QStringLiteral("<A><B>x</A></B>"),
        QStringLiteral("<A></A><B></B>"),
        QStringLiteral("<A>x</A>trailing"),
        QStringLiteral("<A x=1></A>"),
        QStringLiteral("<A>&bogus;</A>"),
        QStringLiteral("<A>\x01</A>"),
        QStringLiteral("<NodeInfo><Cameras><Cam><Name>cam"),
    };
    for (const QString& xml : bad) {
        EXPECT_TRUE(isRefused(xml)) << qPrintable(xml);
    }
}

TEST(Quellon, HostileInputIsRefusedQuicklyAndBounded)
{

    // Entity expansion ("billion laughs") and external entities: any DOCTYPE is refused.
    QString laughs = QStringLiteral("<?xml version=\"1.0\"?><!DOCTYPE l [<!ENTITY l0 \"ha\">");
    for (int i = 1; i < 10; ++i) {
        laughs += QStringLiteral("<!ENTITY l%1 \"%2\">")
                      .arg(i)
                      .arg(QStringLiteral("&l%1;").arg(i - 1).repeated(10));
    }
    laughs += QStringLiteral("]><l>&l9;</l>");
    EXPECT_TRUE(isRefused(laughs));
    EXPECT_TRUE(isRefused(QStringLiteral(
        "<?xml version=\"1.0\"?><!DOCTYPE r [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><r>&x;</r>")));
    EXPECT_TRUE(isRefused(QStringLiteral("<!DOCTYPE r><r>x</r>")));

    // Nesting deeper than the limit is refused; at the limit it is fine.
    const auto nested = [](int depth) {
        return QStringLiteral("<a>").repeated(depth) + QStringLiteral("x") +
               QStringLiteral("</a>").repeated(depth);
    };
    EXPECT_FALSE(isRefused(nested(Quellon::kMaxDepth)));
    EXPECT_TRUE(isRefused(nested(Quellon::kMaxDepth + 1)));
    EXPECT_TRUE(isRefused(nested(200000)));

    // A huge text is just a text.
    const QString big(8 * 1024 * 1024, QLatin1Char('z'));
    const QVariantMap root = parseMap(QStringLiteral("<T>") + big + QStringLiteral("</T>"));
    EXPECT_EQ(root.value(QStringLiteral("T")).toString().size(), big.size());

    // Many siblings beyond the element limit are refused rather than built.
    EXPECT_TRUE(isRefused(QStringLiteral("<r>") + QStringLiteral("<e/>").repeated(Quellon::kMaxElements + 1) +
                          QStringLiteral("</r>")));
}

TEST(Quellon, TransContentAsListGivesOneEntryPerOccurrence)
{
    EXPECT_TRUE(Quellon::transContentAsList(QVariant()).isEmpty());
    const QVariantMap one{{QStringLiteral("Name"), QStringLiteral("a")}};
    const QList<QVariant> single = Quellon::transContentAsList(QVariant(one));
    ASSERT_EQ(single.size(), 1);
    EXPECT_EQ(single.first().toMap(), one);
    const QVariantList two{QVariant(one), QVariant(one)};
    EXPECT_EQ(Quellon::transContentAsList(QVariant(two)).size(), 2);
    EXPECT_EQ(Quellon::transContentAsList(QVariant(QStringLiteral("t"))),
              QList<QVariant>{QStringLiteral("t")});
    // An empty element still occurred once.
    EXPECT_EQ(Quellon::transContentAsList(QVariant(QString())).size(), 1);
}
