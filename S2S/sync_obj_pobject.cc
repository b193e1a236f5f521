#include "S2S/sync_obj_pobject.h"

#include <list>
#include <string>

namespace S2S {

namespace {

void Schedule2PObj(const Schedule& s, PObject& out) {
  out["schedule_mode"] = static_cast<int>(s.GetMode());
  out["schedule_begin_year"] = s.GetBeginYear();
  out["schedule_begin_month"] = s.GetBeginMonth();
  out["schedule_begin_day"] = s.GetBeginDay();
  out["schedule_begin_hour"] = s.GetStartHour();
  out["schedule_begin_min"] = s.GetStartMinute();
  out["week_schd"] = s.GetWeekSchedule();
  out["period_hour"] = static_cast<int>(s.GetPeriodHourPart());
  out["period_minute"] = static_cast<int>(s.GetPeriodMinutePart());
  out["repeat_times_in_day"] = static_cast<int>(s.GetRepeatTimesInDay());
}

// The period goes before the repeat count: a zero in either clears the
// other, and the map's repeat count must be the one that stays.
void PObj2Schedule(const PObject& in, Schedule& s) {
  if (in.hasMember("schedule_mode")) {
    s.SetMode(static_cast<SCHD_MODE>(in["schedule_mode"].asInt32()));
  }
  if (in.hasMember("week_schd")) s.SetWeekSchedule(in["week_schd"].asString());
  if (in.hasMember("period_hour") && in.hasMember("period_minute")) {
    s.SetPeriod(in["period_hour"].asInt32(), in["period_minute"].asInt32());
  }
  if (in.hasMember("repeat_times_in_day")) {
    s.SetRepeatTimesInDay(in["repeat_times_in_day"].asInt32());
  }
  if (in.hasMember("schedule_begin_year")) {
    s.SetBeginYear(in["schedule_begin_year"].asInt32());
  }
  if (in.hasMember("schedule_begin_month")) {
    s.SetBeginMonth(in["schedule_begin_month"].asInt32());
  }
  if (in.hasMember("schedule_begin_day")) {
    s.SetBeginDay(in["schedule_begin_day"].asInt32());
  }
  if (in.hasMember("schedule_begin_hour")) {
    s.SetStartHour(in["schedule_begin_hour"].asInt32());
  }
  if (in.hasMember("schedule_begin_min")) {
    s.SetStartMinute(in["schedule_begin_min"].asInt32());
  }
}

}  // namespace

void TaskInfo2PObj(const TaskInfo& info, PObject& out) {
  out["name"] = info.GetName();
  PObject::Array shares;
  for (const std::string& share : info.GetShareList()) {
    shares.push_back(PObject(share));
  }
  out["share_list"] = shares;

  const SyncInfo& sync = info.GetSyncInfo();
  out["user"] = sync.GetUser();
  out["pswd"] = sync.GetPassword();
  out["server_ip"] = sync.GetServerIP();
  out["server_name"] = sync.GetServerName();
  out["compress"] = sync.UseCompression();
  out["block"] = sync.UseBlockLevelSync();
  out["ssh"] = sync.UseSSH();
  out["ssh_port"] = sync.GetSSHPort();
  out["max_bandwidth"] = sync.GetMaxBandwidth();

  Schedule2PObj(info.GetSchedule(), out);
}

void SyncTask2PObj(const SyncTask& task, PObject& out) {
  out["id"] = task.GetID();
  TaskInfo2PObj(task.GetInfo(), out);
}

void PObj2SyncInfo(const PObject& in, SyncInfo& info) {
  if (in.hasMember("user")) info.SetUser(in["user"].asString());
  if (in.hasMember("pswd")) info.SetPassword(in["pswd"].asString());
  if (in.hasMember("server_ip")) info.SetServerIP(in["server_ip"].asString());
  if (in.hasMember("server_name")) {
    info.SetServerName(in["server_name"].asString());
  }
  if (in.hasMember("compress")) info.SetCompression(in["compress"].asBool());
  if (in.hasMember("block")) info.SetBlockLevelSync(in["block"].asBool());
  if (in.hasMember("ssh")) info.SetSSH(in["ssh"].asBool());
  if (in.hasMember("ssh_port")) info.SetSSHPort(in["ssh_port"].asUInt32());
  if (in.hasMember("max_bandwidth")) {
    info.SetMaxBandwidth(in["max_bandwidth"].asUInt32());
  }
}

void PObj2SyncTask(const PObject& in, SyncTask& task) {
  TaskInfo info;
  SyncInfo sync;
  Schedule schedule;
  if (in.hasMember("id")) task.SetID(in["id"].asUInt64());
  if (in.hasMember("name")) info.SetName(in["name"].asString());
  if (in.hasMember("share_list")) {
    std::list<std::string> shares;
    for (const PObject& share : in["share_list"].asArray()) {
      shares.push_back(share.asString());
    }
    info.SetShareList(shares);
  }
  PObj2SyncInfo(in, sync);
  PObj2Schedule(in, schedule);
  info.SetSchedule(schedule);
  info.SetSyncInfo(sync);
  task.SetInfo(info);
}

void PObj2SyncTask(const PObject& in, SyncTask& task, TASK_STATUS& status,
                   TASK_RESULT& result) {
  PObj2SyncTask(in, task);
  status = static_cast<TASK_STATUS>(in["status"].asInt32());
  result = static_cast<TASK_RESULT>(in["sync_result"].asInt32());
}

}  // namespace S2S
