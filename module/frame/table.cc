#include "module/frame/table.h"

#include "module/frame/wrappers.h"

const ZEPH_API_TABLE gTable[] = {
    {"ZEPH.Core.Certificate", 1, "reset", doCertificateReset_v1},
    {"ZEPH.Core.Certificate", 1, "export", doCertificateExport_v1},
    {"ZEPH.Core.Certificate", 1, "import", doCertificateImport_v1},
    {"ZEPH.Core.Certificate.CSR", 1, "create", doCertificateCreateCSR_v1},
    {"ZEPH.Core.Certificate.CSR", 1, "renew", doCertificateRenew_v1},
    {"ZEPH.Core.Certificate.CSR", 1, "sign", doCertificateSign_v1},
    {"ZEPH.Core.Certificate.CRT", 1, "create", doCertificateCreateCRT_v1},
    {"ZEPH.Core.Certificate.CRT", 1, "recreate", doCertificateRecreateCRT_v1},
    {"ZEPH.Core.Certificate.CRT", 1, "set", doCertificateSetCRT_v1},
    {"ZEPH.Core.Certificate.CRT", 1, "delete", doCertificateDeleteCRT_v1},
    {"ZEPH.Core.Certificate.CRT", 1, "list", doCertificateListCRT_v1},
    {"ZEPH.Core.Certificate.LetsEncrypt", 1, "create", doCertificateCreateLE_v1},
    {"ZEPH.Core.Certificate.LetsEncrypt", 1, "renew", doCertificateRenewLE_v1},
    {"ZEPH.Core.Certificate.LetsEncrypt.Account", 1, "list",
     doCertificateListLEAccount_v1},
    {"ZEPH.Core.Certificate.Service", 1, "set", doCertificateSetService_v1},
    {nullptr, 0, nullptr, nullptr},
};

const ZEPH_API_TABLE* GetAPITable() { return gTable; }
