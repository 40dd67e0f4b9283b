#pragma once
// The store as production installs it: its files live in the "Server" folder of the
// installation directory that the machine settings name.

#include "TamsaWrapper.h"

class TamsaImplement : public TamsaWrapper
{
public:
    TamsaImplement() = default;
    ~TamsaImplement() override;

    // "INSTALL_PATH" of the 32-bit view of the machine key, else of the native view, then the
    // native separator and "Server"; empty when neither holds the value.
    QString getStoragesDBPath() override;
};
