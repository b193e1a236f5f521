#include "S2S/sync_obj_dump.h"

#include <iomanip>
#include <string>

namespace S2S {

namespace {

// Sets width 2 and fill '0' for the next number only; the fill stays.
std::ostream& Pad2(std::ostream& os) {
  return os << std::setw(2) << std::setfill('0');
}

// A number of seconds as hours:minutes.
void HourMinute(std::ostream& os, long seconds) {
  Pad2(os) << seconds / 3600 << ":";
  Pad2(os) << (seconds % 3600) / 60;
}

const char* YesNo(bool b) { return b ? "yes" : "no"; }

}  // namespace

std::ostream& operator<<(std::ostream& os, const Share& share) {
  os << "id: ... " << share.GetID() << std::endl;
  os << "name: . " << share.GetName() << std::endl;
  return os;
}

std::ostream& operator<<(std::ostream& os, const Event& event) {
  os << "id: ............ " << event.GetID() << std::endl;
  os << "share_name: .... " << event.GetShareName() << std::endl;
  os << "relative_path: . " << event.GetRelativePath() << std::endl;
  os << "status: ........ " << static_cast<int>(event.GetStatus()) << std::endl;
  return os;
}

std::ostream& operator<<(std::ostream& os, const Schedule& s) {
  os << "mode: ................ " << s.GetModeStr() << std::endl;
  os << "week_schd: ............. " << s.GetWeekSchedule() << std::endl;
  os << "schedule_begin: ...... " << s.GetBeginYear() << "-";
  Pad2(os) << s.GetBeginMonth() << "-";
  Pad2(os) << s.GetBeginDay() << " ";
  Pad2(os) << s.GetStartHour() << ":";
  Pad2(os) << s.GetStartMinute() << ":";
  Pad2(os) << 0 << std::endl;
  os << "period: .............. ";
  HourMinute(os, s.GetPeriodSeconds());
  os << std::endl;
  os << "repeat_times_in_day: . " << s.GetRepeatTimesInDay() << std::endl;
  long last = s.GetStartHour() * 3600L + s.GetStartMinute() * 60L +
              s.GetRepeatTimesInDay() * s.GetPeriodSeconds();
  os << "last sync in day: .... ";
  HourMinute(os, last);
  os << std::endl;
  return os;
}

std::ostream& operator<<(std::ostream& os, const SyncInfo& info) {
  os << "user: ................. " << info.GetUser() << std::endl;
  os << "server_ip: ............ " << info.GetServerIP() << std::endl;
  os << "server_name: .......... " << info.GetServerName() << std::endl;
  os << "use compression: ...... " << YesNo(info.UseCompression()) << std::endl;
  os << "use block level sync: . " << YesNo(info.UseBlockLevelSync())
     << std::endl;
  os << "use ssh: .............. " << YesNo(info.UseSSH()) << std::endl;
  os << "ssh port: ............. " << info.GetSSHPort() << std::endl;
  os << "max bandwidth: ........ " << info.GetMaxBandwidth() << std::endl;
  return os;
}

std::ostream& operator<<(std::ostream& os, const TaskInfo& info) {
  os << "name: ................. " << info.GetName() << std::endl;
  os << "share_list: ........... ";
  for (const std::string& share : info.GetShareList()) os << share << ",";
  os << std::endl;
  os << "<Server Info>" << std::endl << info.GetSyncInfo();
  os << "<Schedule>" << std::endl << info.GetSchedule();
  return os;
}

std::ostream& operator<<(std::ostream& os, const SyncTask& task) {
  os << "id: ................... " << task.GetID() << std::endl;
  return os << task.GetInfo();
}

}  // namespace S2S
