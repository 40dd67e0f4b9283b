#pragma once
// Everything a case vault answers, as one variant tree: the case list and records, and for
// every case its detail, items, item ids and single-item reads. Used to compare what two
// processes read from the same file.

#include "CaseDatabase.h"

#include <QVariantMap>
#include <algorithm>

inline QVariantMap dumpCaseVault(CaseDatabase& vault)
{
    QVariantMap cases;
    for (const QVariant& record : vault.getAllCase()) {
        const int caseId = record.toMap().value(QStringLiteral("caseId")).toInt();
        QList<int> itemIds = vault.getCaseItemIdSet(caseId).values();
        std::sort(itemIds.begin(), itemIds.end());
        QVariantList ids;
        QVariantList itemInfo;
        for (int itemId : itemIds) {
            ids.append(itemId);
            itemInfo.append(vault.getCaseItemInfoMap(itemId));
        }
        cases.insert(QString::number(caseId), QVariantMap{{"info", vault.getCaseInfoMap(caseId)},
                                                          {"items", vault.getCaseItemList(caseId)},
                                                          {"itemIds", ids},
                                                          {"itemInfo", itemInfo}});
    }
    return {{"caseList", vault.getCaseList()}, {"allCase", vault.getAllCase()}, {"cases", cases}};
}
