#include "systemupdate.h"

SystemUpdate::SystemUpdate() : m_updateType(0), m_blChecked(false) {}
