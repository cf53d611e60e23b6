// nqpm typeinfo / invoke: the module as a late-bound client sees it, from its type information
// alone: nothing here knows the interfaces.
#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>
#include <nqportmanager/client.h>

#include "platform/fs.h"
#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"
#include "tools/nqpm/ModuleClient.h"

namespace nqpm {

namespace {

const char* const kTypeinfoUsage =
    "usage: nqpm typeinfo [--module PATH] [--json]\n"
    "Loads the module's type library and prints every enumeration with its values, every\n"
    "interface with its members (DISPID, kind, parameters and their types) and every class with\n"
    "the interfaces it implements.\n";

const char* const kInvokeUsage =
    "usage: nqpm invoke PROGID MEMBER [ARG...] [';' MEMBER [ARG...]]... [--module PATH]\n"
    "                   [--registry FILE] [--json]\n"
    "Creates the object registered under PROGID (e.g. NqPortManager.AdvancedPortManager) through\n"
    "the module and calls each MEMBER by name through IDispatch, in turn on the same object,\n"
    "printing each result. Arguments are texts that the object changes to its parameter types;\n"
    "MEMBER=VALUE puts a property. Arguments after a lone '--' are never taken as options.\n"
    "Example: nqpm invoke NqPortManager.LocalSipProxy InternalAddress=127.0.0.1 ';' "
    "SenderEndpoint\n";

std::string Name(ITypeInfo* info, MEMBERID memid = MEMBERID_NIL) {
    BStr name;
    info->GetDocumentation(memid, name.Out(), nullptr, nullptr, nullptr);
    return name.Utf8();
}

std::string TypeText(ITypeInfo* info, const TYPEDESC& type) {
    switch (type.vt) {
        case VT_PTR:
            return type.lptdesc != nullptr ? TypeText(info, *type.lptdesc) + "*" : "void*";
        case VT_USERDEFINED: {
            ComPtr<ITypeInfo> named;
            return SUCCEEDED(info->GetRefTypeInfo(type.hreftype, named.GetAddressOf()))
                       ? Name(named.Get())
                       : "?";
        }
        case VT_BSTR:
            return "BSTR";
        case VT_I4:
            return "long";
        case VT_INT:
            return "int";
        case VT_BOOL:
            return "VARIANT_BOOL";
        case VT_VARIANT:
            return "VARIANT";
        case VT_UNKNOWN:
            return "IUnknown*";
        case VT_DISPATCH:
            return "IDispatch*";
        case VT_HRESULT:
            return "HRESULT";
        default:
            return "vt " + std::to_string(type.vt);
    }
}

const char* KindText(TYPEKIND kind) {
    switch (kind) {
        case TKIND_ENUM:
            return "enum";
        case TKIND_INTERFACE:
            return "interface";
        case TKIND_DISPATCH:
            return "dispinterface";
        case TKIND_COCLASS:
            return "coclass";
        default:
            return "type";
    }
}

const char* InvokeKindText(INVOKEKIND kind) {
    return kind == INVOKE_PROPERTYGET ? "get" : kind == INVOKE_PROPERTYPUT ? "put" : "method";
}

// One type of the library as JSON, from its type information.
Json DescribeType(ITypeInfo* info) {
    TYPEATTR* attr = nullptr;
    if (FAILED(info->GetTypeAttr(&attr))) {
        return Json{{"name", Name(info)}, {"error", "no type attributes"}};
    }
    Json type{{"kind", KindText(attr->typekind)}, {"name", Name(info)}};
    if (attr->typekind != TKIND_ENUM) {
        type["guid"] = GuidToString(attr->guid);
    }
    if (attr->typekind == TKIND_INTERFACE) {
        type["dual"] = (attr->wTypeFlags & TYPEFLAG_FDUAL) != 0;
    }
    for (UINT i = 0; i < attr->cVars; ++i) {
        VARDESC* var = nullptr;
        if (SUCCEEDED(info->GetVarDesc(i, &var))) {
            type["values"].push_back(
                {{"name", Name(info, var->memid)},
                 {"value", var->varkind == VAR_CONST ? var->lpvarValue->lVal : 0}});
            info->ReleaseVarDesc(var);
        }
    }
    std::vector<MEMBERID> named;
    for (UINT i = 0; i < attr->cFuncs; ++i) {
        FUNCDESC* func = nullptr;
        if (FAILED(info->GetFuncDesc(i, &func))) {
            continue;
        }
        // GetNames answers for the first member of an id: a put that shares it has unnamed
        // parameters here.
        const bool first = std::find(named.begin(), named.end(), func->memid) == named.end();
        named.push_back(func->memid);
        std::vector<BStr> names(static_cast<size_t>(func->cParams) + 1);
        std::vector<BSTR> raw(names.size(), nullptr);
        UINT count = 0;
        info->GetNames(func->memid, raw.data(), static_cast<UINT>(raw.size()), &count);
        for (size_t n = 0; n < count; ++n) {
            names[n] = BStr::Attach(raw[n]);
        }
        Json member{{"name", Name(info, func->memid)},
                    {"dispid", func->memid},
                    {"kind", InvokeKindText(func->invkind)},
                    {"params", Json::array()}};
        for (SHORT p = 0; p < func->cParams; ++p) {
            const ELEMDESC& e = func->lprgelemdescParam[p];
            const USHORT flags = e.paramdesc.wParamFlags;
            member["params"].push_back(
                {{"name", first && static_cast<UINT>(p) + 1 < count ? names[p + 1].Utf8() : ""},
                 {"type", TypeText(info, e.tdesc)},
                 {"out", (flags & PARAMFLAG_FOUT) != 0},
                 {"retval", (flags & PARAMFLAG_FRETVAL) != 0}});
        }
        type["members"].push_back(member);
        info->ReleaseFuncDesc(func);
    }
    for (UINT i = 0; i < attr->cImplTypes; ++i) {
        HREFTYPE ref = 0;
        INT flags = 0;
        ComPtr<ITypeInfo> implemented;
        if (SUCCEEDED(info->GetRefTypeOfImplType(i, &ref)) &&
            SUCCEEDED(info->GetImplTypeFlags(i, &flags)) &&
            SUCCEEDED(info->GetRefTypeInfo(ref, implemented.GetAddressOf()))) {
            type["implements"].push_back({{"name", Name(implemented.Get())},
                                          {"default", (flags & IMPLTYPEFLAG_FDEFAULT) != 0},
                                          {"source", (flags & IMPLTYPEFLAG_FSOURCE) != 0}});
        }
    }
    info->ReleaseTypeAttr(attr);
    return type;
}

void PrintType(const Json& type) {
    std::printf("%s %s", type["kind"].get<std::string>().c_str(),
                type["name"].get<std::string>().c_str());
    if (type.contains("guid")) {
        std::printf(" %s", type["guid"].get<std::string>().c_str());
    }
    std::printf("%s\n", type.value("dual", false) ? " dual" : "");
    for (const Json& v : type.value("values", Json::array())) {
        std::printf("    %s = %d\n", v["name"].get<std::string>().c_str(), v["value"].get<int>());
    }
    for (const Json& m : type.value("members", Json::array())) {
        std::string params;
        for (const Json& p : m["params"]) {
            params += params.empty() ? "" : ", ";
            params += p["retval"].get<bool>() ? "[out, retval] " : "";
            params += p["type"].get<std::string>();
            params += p["name"] == "" ? "" : " " + p["name"].get<std::string>();
        }
        std::printf("    [%d] %s%s(%s)\n", m["dispid"].get<int>(),
                    m["kind"] == "method" ? "" : (m["kind"].get<std::string>() + " ").c_str(),
                    m["name"].get<std::string>().c_str(), params.c_str());
    }
    for (const Json& i : type.value("implements", Json::array())) {
        const bool def = i["default"].get<bool>();
        const bool source = i["source"].get<bool>();
        std::printf("    %s%s\n",
                    def && source ? "[default, source] "
                    : def         ? "[default] "
                    : source      ? "[source] "
                                  : "",
                    i["name"].get<std::string>().c_str());
    }
}

// Options go to Options; the rest (and all after "--") are the command's words.
std::vector<std::string> SplitArguments(int argc, char** argv,
                                        const std::vector<std::string>& valued,
                                        std::vector<char*>& options) {
    std::vector<std::string> words;
    bool onlyWords = false;
    for (int i = 0; i < argc; ++i) {
        const std::string arg = argv[i];
        if (!onlyWords && arg == "--") {
            onlyWords = true;
        } else if (!onlyWords && (arg.rfind("--", 0) == 0 || arg == "-h")) {
            options.push_back(argv[i]);
            for (const std::string& name : valued) {
                if (arg == "--" + name && i + 1 < argc) {
                    options.push_back(argv[++i]);
                }
            }
        } else {
            words.push_back(arg);
        }
    }
    return words;
}

std::string HexCode(HRESULT hr) {
    char text[16];
    std::snprintf(text, sizeof(text), "0x%08X", static_cast<unsigned>(hr));
    return text;
}

// The enumeration name of a result, from the member's retval type.
std::string EnumName(IDispatch* object, DISPID id, LONG value) {
    ComPtr<ITypeInfo> info;
    TYPEATTR* attr = nullptr;
    if (FAILED(object->GetTypeInfo(0, LOCALE_USER_DEFAULT, info.GetAddressOf())) ||
        FAILED(info->GetTypeAttr(&attr))) {
        return "";
    }
    std::string found;
    for (UINT i = 0; i < attr->cFuncs && found.empty(); ++i) {
        FUNCDESC* func = nullptr;
        if (FAILED(info->GetFuncDesc(i, &func))) {
            continue;
        }
        const ELEMDESC* last =
            func->cParams > 0 ? &func->lprgelemdescParam[func->cParams - 1] : nullptr;
        ComPtr<ITypeInfo> named;
        TYPEATTR* namedAttr = nullptr;
        if (func->memid == id && func->invkind != INVOKE_PROPERTYPUT && last != nullptr &&
            (last->paramdesc.wParamFlags & PARAMFLAG_FRETVAL) != 0 && last->tdesc.vt == VT_PTR &&
            last->tdesc.lptdesc->vt == VT_USERDEFINED &&
            SUCCEEDED(info->GetRefTypeInfo(last->tdesc.lptdesc->hreftype, named.GetAddressOf())) &&
            SUCCEEDED(named->GetTypeAttr(&namedAttr))) {
            for (UINT v = 0; v < namedAttr->cVars; ++v) {
                VARDESC* var = nullptr;
                if (SUCCEEDED(named->GetVarDesc(v, &var))) {
                    if (var->lpvarValue->lVal == value) {
                        found = Name(named.Get(), var->memid);
                    }
                    named->ReleaseVarDesc(var);
                }
            }
            named->ReleaseTypeAttr(namedAttr);
        }
        info->ReleaseFuncDesc(func);
    }
    info->ReleaseTypeAttr(attr);
    return found;
}

Json ValueJson(IDispatch* object, DISPID id, const VARIANT& v) {
    switch (v.vt) {
        case VT_EMPTY:
            return nullptr;
        case VT_BSTR:
            return Utf8FromBstr(v.bstrVal);
        case VT_BOOL:
            return v.boolVal != VARIANT_FALSE;
        case VT_I4:
        case VT_INT: {
            const std::string name = EnumName(object, id, v.lVal);
            return name.empty() ? Json(v.lVal) : Json{{"name", name}, {"value", v.lVal}};
        }
        case VT_UNKNOWN:
        case VT_DISPATCH:
            return v.punkVal != nullptr ? "(object)" : "(null)";
        default:
            return "(vt " + std::to_string(v.vt) + ")";
    }
}

std::string ValueText(const Json& value) {
    if (value.is_null()) {
        return "done";
    }
    if (value.is_string()) {
        return value.get<std::string>();
    }
    if (value.is_object()) {
        return value["name"].get<std::string>() + " (" + std::to_string(value["value"].get<int>()) +
               ")";
    }
    return value.dump();
}

}  // namespace

int RunTypeinfo(int argc, char** argv) {
    Options options("typeinfo", {{"module", true}}, kTypeinfoUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kTypeinfoUsage, stdout);
        return kExitOk;
    }
    ModuleClient client(options.Value("module"));
    ComPtr<ITypeLib> library;
    const HRESULT hr = client.LoadTypeLibrary(library.GetAddressOf());
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm typeinfo: %s has no type library (%s)\n", client.Path().c_str(),
                     HexCode(hr).c_str());
        return kExitFailed;
    }
    BStr name, help;
    library->GetDocumentation(-1, name.Out(), help.Out(), nullptr, nullptr);
    TLIBATTR* attr = nullptr;
    Json lib{{"name", name.Utf8()}, {"help", help.Utf8()}};
    if (SUCCEEDED(library->GetLibAttr(&attr))) {
        lib["guid"] = GuidToString(attr->guid);
        lib["version"] =
            std::to_string(attr->wMajorVerNum) + "." + std::to_string(attr->wMinorVerNum);
        lib["lcid"] = attr->lcid;
        library->ReleaseTLibAttr(attr);
    }
    Json types = Json::array();
    for (UINT i = 0; i < library->GetTypeInfoCount(); ++i) {
        ComPtr<ITypeInfo> info;
        if (SUCCEEDED(library->GetTypeInfo(i, info.GetAddressOf()))) {
            types.push_back(DescribeType(info.Get()));
        }
    }
    if (options.Json()) {
        PrintJson({{"library", lib}, {"types", types}});
        return kExitOk;
    }
    std::printf("library %s %s %s \"%s\"\n", lib["name"].get<std::string>().c_str(),
                lib.value("version", "?").c_str(), lib.value("guid", "?").c_str(),
                lib["help"].get<std::string>().c_str());
    for (const Json& type : types) {
        PrintType(type);
    }
    return kExitOk;
}

int RunInvoke(int argc, char** argv) {
    std::vector<char*> optionArgs;
    const std::vector<std::string> words =
        SplitArguments(argc, argv, {"module", "registry", "log-level", "log-folder"}, optionArgs);
    Options options("invoke", {{"module", true}, {"registry", true}}, kInvokeUsage);
    options.Parse(static_cast<int>(optionArgs.size()), optionArgs.data());
    if (options.WantsHelp()) {
        std::fputs(kInvokeUsage, stdout);
        return kExitOk;
    }
    if (words.size() < 2) {
        throw UsageError("a ProgID and a member are needed");
    }
    if (options.Has("registry")) {
        platform::SetEnvironmentValue("NQPM_REGISTRY", options.Value("registry"));
    }
    CLSID clsid{};
    if (FAILED(nqportmanager::CLSIDFromProgID(words[0], clsid))) {
        std::fprintf(stderr, "nqpm invoke: %s is not registered (see 'nqpm register')\n",
                     words[0].c_str());
        return kExitFailed;
    }
    ModuleClient client(options.Value("module"));
    ComPtr<IDispatch> object;
    HRESULT hr = client.Create(clsid, IID_IDispatch, object.GetVoidAddressOf());
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm invoke: cannot create %s (%s)\n", words[0].c_str(),
                     HexCode(hr).c_str());
        return kExitFailed;
    }
    client.ConfigureLogging(LogSettingsOf(options), object.Get());

    // Calls separated by ';': the member, then its arguments.
    for (size_t start = 1; start < words.size();) {
        size_t end = start;
        while (end < words.size() && words[end] != ";") {
            ++end;
        }
        std::string member = words[start];
        std::vector<std::string> args(words.begin() + static_cast<ptrdiff_t>(start) + 1,
                                      words.begin() + static_cast<ptrdiff_t>(end));
        start = end + 1;
        WORD flags = DISPATCH_METHOD | DISPATCH_PROPERTYGET;
        if (const size_t eq = member.find('='); eq != std::string::npos) {
            args.insert(args.begin(), member.substr(eq + 1));
            member.resize(eq);
            flags = DISPATCH_PROPERTYPUT;
        }
        BStr name(member);
        LPOLESTR names[] = {name.Get()};
        DISPID id = DISPID_UNKNOWN;
        if (FAILED(object->GetIDsOfNames(GUID_NULL, names, 1, LOCALE_USER_DEFAULT, &id))) {
            std::fprintf(stderr, "nqpm invoke: %s has no member %s\n", words[0].c_str(),
                         member.c_str());
            return kExitFailed;
        }
        // Arguments go last first, as IDispatch takes them.
        std::vector<VARIANT> rgvarg;
        for (auto it = args.rbegin(); it != args.rend(); ++it) {
            VARIANT v;
            v.vt = VT_BSTR;
            v.bstrVal = BstrFromUtf8(*it);
            rgvarg.push_back(v);
        }
        DISPID put = DISPID_PROPERTYPUT;
        DISPPARAMS params{rgvarg.data(), &put, static_cast<UINT>(rgvarg.size()),
                          flags == DISPATCH_PROPERTYPUT ? 1u : 0u};
        VARIANT result;
        VariantInit(&result);
        EXCEPINFO info{};
        UINT argErr = 0;
        hr = object->Invoke(id, GUID_NULL, LOCALE_USER_DEFAULT, flags, &params, &result, &info,
                            &argErr);
        for (VARIANT& v : rgvarg) {
            VariantClear(&v);
        }
        BStr description = BStr::Attach(info.bstrDescription);
        BStr source = BStr::Attach(info.bstrSource);
        if (FAILED(hr)) {
            std::string why = HexCode(hr);
            if (hr == DISP_E_EXCEPTION) {
                why += ": the member failed with " + HexCode(info.scode) +
                       (description.IsNull() ? "" : " (" + description.Utf8() + ")");
            } else if (hr == DISP_E_TYPEMISMATCH || hr == DISP_E_OVERFLOW ||
                       hr == DISP_E_PARAMNOTOPTIONAL) {
                why += ": argument " + std::to_string(args.size() - argErr) + " does not fit";
            } else if (hr == DISP_E_BADPARAMCOUNT) {
                why += ": wrong number of arguments";
            }
            std::fprintf(stderr, "nqpm invoke: %s failed, %s\n", member.c_str(), why.c_str());
            return kExitFailed;
        }
        const Json value = ValueJson(object.Get(), id, result);
        VariantClear(&result);
        if (options.Json()) {
            PrintJson({{"member", member}, {"result", value}});
        } else {
            std::printf("%s: %s\n", member.c_str(), ValueText(value).c_str());
        }
    }
    return kExitOk;
}

}  // namespace nqpm
