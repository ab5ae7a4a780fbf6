// SPDX-License-Identifier: MIT
// Perform: VarniskStatus reports the last collection's time stamp, whose folder is written so
// that the path the tool prints exists.
#include "sim/HelperObject.h"

#include <string>
#include <string_view>
#include <utility>

#include "platform/ServerProtocol.h"
#include "platform/linux/BusProtocol.h"
#include "sim/Replies.h"
#include "sim/RequestLog.h"

namespace halvex::sim {
namespace {

constexpr ObjectNames kNames{bus::kHelperName, bus::kHelperPath, bus::kHelperInterface, "helper"};

}  // namespace

// Argument names are those of data/dbus/interfaces/*.xml, which a test holds equal to these.
const sd_bus_vtable HelperObject::kVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES(bus::kHelperPerform, "sisa{sv}",
                             SD_BUS_PARAM(service) SD_BUS_PARAM(task) SD_BUS_PARAM(command)
                                 SD_BUS_PARAM(request),
                             "isv", SD_BUS_PARAM(code) SD_BUS_PARAM(message) SD_BUS_PARAM(reply),
                             &HelperObject::onPerform, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

HelperObject::HelperObject(Helper scenario, const DeviceObject& device, const Services& services)
    : scenario_(std::move(scenario)),
      device_(device),
      services_(services),
      endpoint_(kNames, kVtable, this, services) {}

int HelperObject::onPerform(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<HelperObject*>(userdata);
    const char* service = nullptr;
    std::int32_t task = 0;
    const char* command = nullptr;
    int r = sd_bus_message_read(call, "sis", &service, &task, &command);
    if (r < 0) {
      return r;
    }
    const std::string asked =
        std::string("Perform ") + command + " of " + service + ", task " + std::to_string(task);
    MessageDict request;
    if (r = readRequest(call, error, request, self->endpoint_, asked); r < 0) {
      return r;
    }
    self->services_.log.write({{"service", "helper"},
                               {"method", bus::kHelperPerform},
                               {"client", service},
                               {"task", task},
                               {"command", command},
                               {"keys", describeKeys(request)}});

    Replier& replies = self->services_.replies;
    if (std::string_view(command) != helper::kCommandVarniskStatus) {
      replies.respond(self->endpoint_, call, Answer{}, makeReply(asked, Answer{}, {}, ""));
      return 1;
    }
    const Answer& answer = self->scenario_.status;
    Reply reply = stampedReply(asked, answer, helper::kKeyTimestampString, true);
    // The tool prints the folder of that time stamp; make sure it is there.
    if (answer.result == 0 && answer.reply == ReplyKind::kDict && !reply.timestamp.empty()) {
      reply.logSet = logSetForHelper(reply.timestamp, self->device_.vendorSeenByTool());
      reply.description = "Last collection reported by the simulated helper, time stamp \"" +
                          reply.timestamp + "\"";
    }
    replies.respond(self->endpoint_, call, answer, std::move(reply));
    return 1;
  });
}

}  // namespace halvex::sim
