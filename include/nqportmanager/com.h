// All COM types at once, for code that uses several of them.
#pragma once

#include <nqportmanager/bstr.h>
#include <nqportmanager/cominterfaces.h>
#include <nqportmanager/comtypes.h>
#include <nqportmanager/errorinfo.h>
#include <nqportmanager/guid.h>
#include <nqportmanager/safearray.h>
#include <nqportmanager/variant.h>
