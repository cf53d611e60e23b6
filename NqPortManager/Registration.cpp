#include "NqPortManager/Registration.h"

#include <map>

#include "NqPortManager/Registrar.h"
#include "NqPortManager/Registry.h"
#include "automation/NqPortManagerLib.h"

namespace registry {

const char kAppIdScript[] = R"(HKCR
{
    NoRemove AppID
    {
        '%APPID%' = s 'NqPortManager'
        'NqPortManager.DLL'
        {
            val AppID = s '%APPID%'
        }
    }
}
)";

const char kClassScript[] = R"(HKCR
{
    NqPortManager.%CLASS%.1 = s '%CLASS% Class'
    {
        CLSID = s '%CLSID%'
    }
    NqPortManager.%CLASS% = s '%CLASS% Class'
    {
        CLSID = s '%CLSID%'
        CurVer = s 'NqPortManager.%CLASS%.1'
    }
    NoRemove CLSID
    {
        ForceRemove %CLSID% = s '%CLASS% Class'
        {
            ProgID = s 'NqPortManager.%CLASS%.1'
            VersionIndependentProgID = s 'NqPortManager.%CLASS%'
            ForceRemove 'Programmable'
            InprocServer32 = s '%MODULE%'
            {
                val ThreadingModel = s 'Apartment'
            }
            val AppID = s '%APPID%'
            'TypeLib' = s '%LIBID%'
        }
    }
}
)";

const char kTypeLibScript[] = R"(HKCR
{
    NoRemove TypeLib
    {
        ForceRemove %LIBID%
        {
            %LIBVERSION% = s '%LIBHELP%'
            {
                0
                {
                    linux64 = s '%MODULE%'
                }
                FLAGS = s '0'
                HELPDIR = s '%MODULEDIR%'
            }
        }
    }
}
)";

namespace {

bool Run(const char* text, const std::map<std::string, std::string>& replacements, bool registering,
         RegistryKey& root, std::string& error) {
    Script script;
    if (!ParseScript(text, replacements, script, error)) {
        return false;
    }
    RunScript(script, root, registering);
    return true;
}

}  // namespace

HRESULT UpdateRegistration(bool registering, const std::vector<RegisteredClass>& classes,
                           const std::string& modulePath, const std::string& registryPath,
                           std::string& error) {
    const std::string folder = modulePath.substr(0, modulePath.find_last_of('/') + 1);
    const automation::LibraryDesc& library = automation::NqPortManagerLibrary();
    std::map<std::string, std::string> replacements = {
        {"MODULE", modulePath},
        {"MODULEDIR", folder.empty() ? "." : folder},
        {"APPID", GuidToString(APPID_NqPortManager)},
        {"LIBID", GuidToString(*library.guid)},
        {"LIBVERSION",
         std::to_string(library.majorVersion) + "." + std::to_string(library.minorVersion)},
        {"LIBHELP", library.doc},
    };
    HRESULT result = S_OK;
    const auto edit = [&](RegistryKey& root, std::string& why) {
        result = SELFREG_E_CLASS;
        if (!Run(kAppIdScript, replacements, registering, root, why)) {
            return false;
        }
        for (const RegisteredClass& c : classes) {
            replacements["CLASS"] = c.name;
            replacements["CLSID"] = GuidToString(*c.clsid);
            if (!Run(kClassScript, replacements, registering, root, why)) {
                return false;
            }
        }
        result = SELFREG_E_TYPELIB;
        if (!Run(kTypeLibScript, replacements, registering, root, why)) {
            return false;
        }
        result = S_OK;
        return true;
    };
    if (EditRegistryFile(registryPath, edit, error)) {
        return S_OK;
    }
    return FAILED(result) ? result : E_FAIL;
}

}  // namespace registry
