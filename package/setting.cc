// The package center's settings (update notices, trust level, update
// channel, automatic updates), its default volume and the configuration the
// desktop reads when the package center opens.

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <string>
#include <unistd.h>

#include "error_codes.h"
#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/last_error.h"
#include "klibc/string_list.h"
#include "klibc/sysroot.h"
#include "log_line.h"
#include "package_webapi.h"
#include "pkgserver/auto_update.h"
#include "pkgserver/send_request.h"
#include "pkgserver/server_config.h"
#include "pkgtool/pms.h"
#include "request_values.h"
#include "settings/kivo_settings.h"
#include "settings/mail_config.h"
#include "settings/update_schedule.h"
#include "settings/web_utils.h"
#include "storage/volume_list.h"

#include <strings.h>

namespace KIVO_PACKAGE {

namespace {

constexpr char kInfoConf[] = "/etc/kivoinfo.conf";
constexpr char kFirstVisitMarker[] = "/usr/kivo/kivoman/webman/modules/PkgManApp/recommend.tmp";
constexpr char kFeedFile[] = "/usr/kivo/etc/packages/feeds";
constexpr char kPkgManKey[] = "KIVO.PXS.PkgManApp.Instance";
constexpr int kTosHashMaxAge = 3600;  // seconds a cached terms-of-service hash is used

// The value of `key` in the settings file, "" when missing or unreadable.
std::string InfoValue(const char* key) {
  char buf[128] = {0};
  if (KLIBCFileGetKeyValue(KIVORootPath(kInfoConf).c_str(), key, buf, sizeof(buf), 0) <= 0) {
    return "";
  }
  return buf;
}

bool InfoValueIs(const char* key, const char* value) {
  return strcasecmp(InfoValue(key).c_str(), value) == 0;
}

// Writes one key of the settings file, logging the one that failed.
bool SetInfoValue(const char* key, const std::string& value) {
  if (KLIBCINFOSetKeyValue(key, value.c_str()) == 0) return true;
  PKG_LOG_ERR("Failed to set info key [%s] to [%s]", key, value.c_str());
  return false;
}

bool MailIsSetUp() {
  PKIVO_MAIL mail = nullptr;
  if (KIVOMailGet(&mail) != 0) return false;
  bool set = !mail->smtp_server.empty();
  KIVOMailFree(mail);
  return set;
}

const char* VolumeStatus(int err) {
  switch (err) {
    case KLIBC_ERR_NO_SPACE:
      return "no_space";
    case KLIBC_ERR_VOLUME_CRASHED:
      return "crashed";
    case KLIBC_ERR_VOLUME_NOT_FOUND:
      return "no_found";
    default:
      return "unknown";
  }
}

// "default_vol" when one is set, or "volume_status" when it cannot be
// determined. True when the volume was determined.
bool FillDefaultVolume(Json::Value& out) {
  std::string path;
  if (!PMSGetPackageDefVol(path)) {
    out["volume_status"] = VolumeStatus(KLIBCErrGet());
    return false;
  }
  if (!path.empty()) out["default_vol"] = path;
  return true;
}

// A scalar parameter as text, as the desktop sends it ("true", "5", "beta");
// `def` when absent or not a scalar.
std::string TextParam(const APIRequest& request, const char* name, const char* def) {
  Json::Value v = request.GetParam(name);
  if (v.isString()) return v.asString();
  if (v.isBool()) return v.asBool() ? "true" : "false";
  if (v.isIntegral()) return v.isInt64() ? std::to_string(v.asInt64()) : v.asString();
  return def;
}

bool ParseJson(const std::string& text, Json::Value& out) {
  return KIVOParseJson(text, &out, JsonSyntax::Lenient);
}

// The chosen list of the "set" request: an array as sent, or a JSON text of
// one. Null when not given; false when the text is not JSON or the list is
// not an array of package ids (each checked whole, as the string it is).
bool ChosenPackages(const APIRequest& request, Json::Value& list) {
  list = Json::Value();
  Json::Value v = request.GetParam("packages");
  if (v.isArray()) {
    list = v;
  } else if (v.isString() && !v.asString().empty() && !ParseJson(v.asString(), list)) {
    return false;
  }
  return list.isNull() || (list.isArray() && AreIdsOrEmpty(list));
}

// Drops every `id` from `list` (add: false), or appends it when missing
// (add: true).
Json::Value EditChosenList(const Json::Value& list, const std::string& id, bool add) {
  Json::Value out(Json::arrayValue);
  bool present = false;
  for (const Json::Value& entry : list) {
    if (entry.isString() && entry.asString() == id) {
      present = true;
      if (!add) continue;
    }
    out.append(entry);
  }
  if (add && !present) out.append(id);
  return out;
}

// The cached terms-of-service hash of the user's settings when it is less
// than an hour old (a timestamp in the future counts as fresh).
bool CachedTosHash(const Json::Value& settings, std::string& hash, int& timestamp) {
  const Json::Value& app = settings[kPkgManKey];
  if (!app.isObject() || !app["tos_hash_timestamp"].isInt() || !app["tos_hash"].isString()) {
    return false;
  }
  int age = static_cast<int>(time(nullptr) - app["tos_hash_timestamp"].asInt());
  if (age >= kTosHashMaxAge) return false;
  hash = app["tos_hash"].asString();
  timestamp = app["tos_hash_timestamp"].asInt();
  return true;
}

// Asks the vendor's company-information endpoint for the current hash.
// `answer` gets the raw answer (empty when none came); true when it held a
// string "content_hash", which then replaces `answer`.
bool FetchTosHash(std::string& answer) {
  answer.clear();
  PKLIBSZHASH params = KLIBCSzHashAlloc(1024);
  if (params == nullptr) {
    PKG_LOG_ERR("KLIBCSzHashAlloc failed [0x%04X %s:%d]", KLIBCErrGet(), KLIBCErrorGetFile(),
                KLIBCErrorGetLine());
    return false;
  }
  bool found = false;
  if (KLIBCSzHashSetValue(&params, "action", "getTOSContentHash") != 0) {
    PKG_LOG_ERR("Fail to set key (%s)[0x%04X %s:%d]", "action", KLIBCErrGet(), KLIBCErrorGetFile(),
                KLIBCErrorGetLine());
  } else if (KIVOPackageTool::PMSDownloadSendRequest(PMSLoadServerConfig().company_info_url, false,
                                                     answer, params)) {
    Json::Value reply;
    if (ParseJson(answer, reply) && reply.isObject() && reply["content_hash"].isString()) {
      answer = reply["content_hash"].asString();
      found = true;
    }
  } else {
    answer.clear();
  }
  KLIBCSzHashFree(params);
  return found;
}

const char* ShowTos(const Json::Value& settings, const std::string& hash) {
  const Json::Value& app = settings[kPkgManKey];
  if (!app.isObject()) return "new";
  if (!app["termofservice"].isBool() || !app["termofservice"].asBool()) return "new";
  if (!app["termofservice_4_2"].isBool() || !app["termofservice_4_2"].asBool()) return "change";
  if (!app["agreed_tos_hash"].isString() || app["agreed_tos_hash"].asString() != hash) {
    return "change";
  }
  return "no";
}

// True when the feed list holds at least one feed.
bool HasOtherServer() {
  const std::string path = KIVORootPath(kFeedFile);
  std::string text;
  if (!KLIBCFileExist(path.c_str()) || !KIVOReadFile(path, &text, 1) || text.empty()) return false;
  Json::Value feeds;
  if (!WebUtils::LoadJsonFile(path, feeds)) {
    PKG_LOG_ERR("Fail to load %s, %m", path.c_str());
    return false;
  }
  return (feeds.isArray() || feeds.isObject()) && feeds.size() > 0;
}

}  // namespace

void PackageWebAPI::GetDefVol() {
  Json::Value result(Json::objectValue);
  if (!FillDefaultVolume(result)) {
    response->SetError(kErrFailed, result);
    return;
  }
  response->SetSuccess(result.empty() ? Json::Value() : result);
}

bool PackageWebAPI::SavePackageDefVolPath(std::string path, Json::Value& /*result*/) {
  if (PMSSavePackageDefVolPath(path)) return true;
  response->SetError(KLIBCErrGet() == KLIBC_ERR_NO_SPACE ? kErrNoRoomOnVolume : kErrNoVolume,
                     Json::Value());
  return false;
}

void PackageWebAPI::SetDefVol() {
  Json::Value unused;
  if (!SavePackageDefVolPath(TextParam(*request, "default_vol", ""), unused)) return;
  response->SetSuccess(Json::Value());
}

void PackageWebAPI::GetSetting() {
  Json::Value result(Json::objectValue);
  result["enable_email"] = InfoValueIs("upgrade_pkg_email_notification", "yes");
  result["enable_nvx"] = InfoValueIs("upgrade_pkg_nvx_notification", "yes");
  result["mailset"] = MailIsSetUp();
  result["trust_level"] = std::atoi(InfoValue("pkg_source_trust_level").c_str());
  result["update_channel"] = KLIBCFileCheckKeyValue(KIVORootPath(kInfoConf).c_str(),
                                                    "package_update_channel", "beta", 0) == 1;
  // The list only adds detail: settings are answered without it.
  (void)KIVO::PXS::STORAGE_WEBUTILS::Volume(1).VolumeListGet(result, false);
  (void)FillDefaultVolume(result);
  const KIVOPackageServer::AutoUpdateMode mode = KIVOPackageServer::ReadMode();
  result["enable_autoupdate"] = mode != KIVOPackageServer::AutoUpdateMode::kOff;
  result["autoupdateall"] = mode != KIVOPackageServer::AutoUpdateMode::kChosen;
  response->SetSuccess(result);
}

void PackageWebAPI::SetSetting() {
  // A list that cannot be stored refuses the request before any step is.
  Json::Value packages;
  if (!ChosenPackages(*request, packages)) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  const std::string channel =
      TextParam(*request, "update_channel", "") == "beta" ? "beta" : "stable";
  const bool mail = TextParam(*request, "enable_email", "") == "true" && MailIsSetUp();
  const bool desktop = TextParam(*request, "enable_nvx", "") == "true";
  Json::Value failed(Json::objectValue);
  // Each step commits by itself; the answer names the step that failed.
  auto fail = [&](const char* step) {
    failed["failed"] = step;
    response->SetError(kErrFailed, failed);
  };
  if (!SetInfoValue("pkg_source_trust_level", TextParam(*request, "trust_level", "0"))) {
    return fail("trust_level");
  }
  if (!SetInfoValue("package_update_channel", channel)) return fail("update_channel");
  if (!PMSSavaSchedule(desktop, mail, -1)) return fail("notification");
  if (!KIVOPackageServer::Save(TextParam(*request, "enable_autoupdate", "") == "true",
                               TextParam(*request, "autoupdateall", "") == "true", packages)) {
    return fail("autoupdate");
  }
  Json::Value unused;
  if (request->HasParam("default_vol") &&
      !SavePackageDefVolPath(TextParam(*request, "default_vol", ""), unused)) {
    return;
  }
  Json::Value result(Json::objectValue);
  result["update_channel"] = channel;
  result["enable_email"] = mail;
  result["enable_nvx"] = desktop;
  response->SetSuccess(result);
}

void PackageWebAPI::AddAutoUpdate() { SetAutoUpdate(true); }

void PackageWebAPI::DelAutoUpdate() { SetAutoUpdate(false); }

void PackageWebAPI::SetAutoUpdate(bool add) {
  std::string id;
  if (!SinglePackageId(request->GetParam("id"), &id)) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  Json::Value list(Json::arrayValue);
  switch (KIVOPackageServer::ReadMode()) {
    case KIVOPackageServer::AutoUpdateMode::kOff:
      if (add) list.append(id);
      break;
    case KIVOPackageServer::AutoUpdateMode::kAll:
      for (const std::string& installed : pkgMgr.enumPackages()) {
        if (add || installed != id) list.append(installed);
      }
      break;
    case KIVOPackageServer::AutoUpdateMode::kChosen: {
      Json::Value stored;
      if (!KIVOPackageServer::List(stored)) {
        response->SetError(kErrFailed, Json::Value());
        return;
      }
      list = EditChosenList(stored, id, add);
      break;
    }
  }
  if (!KIVOPackageServer::Save(true, false, list)) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  response->SetSuccess(Json::Value());
}

void PackageWebAPI::LoadConfig() {
  Json::Value reply(Json::objectValue);
  std::string volume;
  reply["def_void"] = PMSGetPackageDefVol(volume) ? volume : "";
  reply["has_packages"] = VisitedBefore() && !pkgMgr.enumPackages().empty();
  reply["show_tos"] = "no";
  reply["tos_hash"] = "";
  reply["tos_hash_timestamp"] = 0;
  FillTermsOfService(reply);
  reply["blOtherServer"] = HasOtherServer();
  response->SetSuccess(reply);
}

bool PackageWebAPI::VisitedBefore() {
  const std::string marker = KIVORootPath(kFirstVisitMarker);
  if (access(marker.c_str(), F_OK) == 0) return true;
  // The marker only records the first visit: failing to leave it just means
  // the next visit counts as a first one too.
  (void)KIVOFSMkdirP(marker.substr(0, marker.rfind('/')).c_str());
  if (FILE* f = fopen(marker.c_str(), "w")) fclose(f);
  return false;
}

void PackageWebAPI::FillTermsOfService(Json::Value& reply) {
  KivoSettings user(request->GetLoginUserName());
  Json::Value settings;
  if (!user.loadUserJsonSettings(settings)) {
    PKG_LOG_ERR("Failed to load user settings");
    return;
  }
  std::string hash;
  int timestamp = 0;
  bool known = CachedTosHash(settings, hash, timestamp);
  if (!known && FetchTosHash(hash)) {
    known = true;
    timestamp = static_cast<int>(time(nullptr));
    // The fetch took a while: the user may have agreed meanwhile in another
    // tab. Only the cached hash is written, into the document as it is now.
    auto cache = [&](Json::Value& current) {
      Json::Value& app = current[kPkgManKey];
      if (!app.isObject()) app = Json::Value(Json::objectValue);
      app["tos_hash"] = hash;
      app["tos_hash_timestamp"] = timestamp;
      settings = current;
      return true;
    };
    if (!user.updateUserJsonSettings(cache)) PKG_LOG_ERR("Failed to save user settings");
  }
  if (known) {
    reply["tos_hash"] = hash;
    reply["tos_hash_timestamp"] = timestamp;
  } else {
    PKG_LOG_ERR("Failed to get tos hash");
  }
  reply["show_tos"] = ShowTos(settings, hash);
}

}  // namespace KIVO_PACKAGE
