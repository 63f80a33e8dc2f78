#include "Statistics/Service/MxReportingRequestDispatch.h"

#include <functional>
#include <limits>
#include <map>

#include <fmt/format.h>

#include "Statistics/Service/MxReportingServiceProtocol.h"
#include "wire/MxReportingMethods.h"

namespace mx {

namespace {

// The reporters one message may name: each costs the message its sinks' events and a
// delivery, so that no one request holds the server queue for long. Past it the
// message is refused whole, as at every limit.
constexpr std::size_t kMaximumReporterIDs = 4096;

// Reads the arguments of one request, remembering the first that does not fit.
class Arguments {
public:
    Arguments(const std::string& method, const Array& params) : method_(method), params_(params) {}

    std::int64_t integer(std::size_t index, std::int64_t minimum, std::int64_t maximum, const char* what)
    {
        const Value& value = params_[index];
        if (const std::int64_t* number = value.asInt(); number && *number >= minimum && *number <= maximum)
            return *number;
        refuse(index, what);
        return 0;
    }

    std::uint64_t unsignedInteger(std::size_t index, std::uint64_t maximum, const char* what)
    {
        const Value& value = params_[index];
        if (const std::int64_t* number = value.asInt(); number && *number >= 0 && std::uint64_t(*number) <= maximum)
            return std::uint64_t(*number);
        if (const std::uint64_t* number = value.asUInt(); number && *number <= maximum)
            return *number;
        refuse(index, what);
        return 0;
    }

    ReporterID reporterID(std::size_t index)
    {
        return integer(index, std::numeric_limits<std::int64_t>::min(), std::numeric_limits<std::int64_t>::max(),
                       "a signed 64-bit reporter ID");
    }

    Dictionary dictionary(std::size_t index)
    {
        if (const Dictionary* dictionary = params_[index].asDictionary())
            return *dictionary;
        refuse(index, "a map");
        return {};
    }

    std::optional<Dictionary> optionalDictionary(std::size_t index)
    {
        if (params_[index].isNil())
            return std::nullopt;
        return dictionary(index);
    }

    std::optional<Array> reporterIDs(std::size_t index)
    {
        if (params_[index].isNil())
            return std::nullopt;
        const Array* array = params_[index].asArray();
        if (!array) {
            refuse(index, "an array of reporter IDs or nil");
            return std::nullopt;
        }
        if (array->size() > kMaximumReporterIDs && !error_)
            error_ = ServiceError{kServiceErrorLimit, fmt::format("too many reporter IDs ({})", kMaximumReporterIDs)};
        return *array;
    }

    const std::optional<ServiceError>& error() const { return error_; }

private:
    void refuse(std::size_t index, const char* what)
    {
        if (!error_)
            error_ = ServiceError{kServiceErrorBadArguments,
                                  fmt::format("argument {} of {} must be {}", index + 1, method_, what)};
    }

    const std::string& method_;
    const Array& params_;
    std::optional<ServiceError> error_;
};

using Responder = std::shared_ptr<ServiceReply>;
using Call = std::function<void(MxReportingServiceProtocol&, Arguments&, const Responder&)>;

struct Operation {
    std::size_t arity;
    Call call;
};

MxBoolReply boolReply(const Responder& responder)
{
    return [responder](bool value) {
        responder->respond(value);
    };
}

// A limit met is the connection layer's error: a reply of the protocol never says it.
std::function<void(const std::string&)> limitRefusal(const Responder& responder)
{
    return [responder](const std::string& limit) {
        responder->fail({kServiceErrorLimit, limit});
    };
}

// The four operations that take a reporter ID and answer with a bool.
Operation reporterOperation(void (MxReportingServiceProtocol::*call)(ReporterID, MxBoolReply))
{
    return {1, [call](MxReportingServiceProtocol& service, Arguments& args, const Responder& responder) {
                auto id = args.reporterID(0);
                if (!args.error())
                    (service.*call)(id, boolReply(responder));
            }};
}

const std::map<std::string, Operation, std::less<>>& operations()
{
    static const std::map<std::string, Operation, std::less<>> table = {
        {std::string(method::kCreateReportingSession),
         {1,
          [](auto& service, auto& args, const Responder& responder) {
              auto id = args.reporterID(0);
              if (!args.error())
                  service.createReportingSession(id, MxCreateReply(boolReply(responder), limitRefusal(responder)));
          }}},
        {std::string(method::kSetServiceType),
         {2,
          [](auto& service, auto& args, const Responder& responder) {
              auto type = static_cast<ServiceType>(args.unsignedInteger(0, 0xFFFF, "an unsigned 16-bit service type"));
              auto id = args.reporterID(1);
              if (!args.error())
                  service.setServiceType(type, id, boolReply(responder));
          }}},
        {std::string(method::kGetServiceNameForReporterID),
         {1,
          [](auto& service, auto& args, const Responder& responder) {
              auto id = args.reporterID(0);
              if (!args.error())
                  service.getServiceNameForReporterID(id, [responder](ServiceType type) { responder->respond(type); });
          }}},
        {std::string(method::kSetConfiguration),
         {2,
          [](auto& service, auto& args, const Responder& responder) {
              auto configuration = args.optionalDictionary(0);
              auto id = args.reporterID(1);
              if (!args.error())
                  service.setConfiguration(std::move(configuration), id, boolReply(responder));
          }}},
        {std::string(method::kStartReportingSessionForID),
         {1,
          [](auto& service, auto& args, const Responder& responder) {
              auto id = args.reporterID(0);
              if (!args.error())
                  service.startReportingSessionForID(
                      id, MxHeldReply(boolReply(responder), [responder] { responder->hold(); }));
          }}},
        {std::string(method::kSendMessage),
         {4,
          [](auto& service, auto& args, const Responder& responder) {
              auto payload = args.dictionary(0);
              auto category =
                  static_cast<MessageCategory>(args.unsignedInteger(1, 0xFFFFFFFF, "an unsigned 32-bit category"));
              auto type = static_cast<MessageType>(args.unsignedInteger(2, 0xFFFF, "an unsigned 16-bit message type"));
              auto ids = args.reporterIDs(3);
              if (!args.error())
                  service.sendMessage(
                      std::move(payload), category, type, std::move(ids),
                      MxErrorReply(
                          [responder](std::optional<MxReportingError> error) {
                              if (!error)
                                  responder->respond(Value());
                              else
                                  responder->respond(Dictionary{{"domain", error->domain}, {"code", error->code}});
                          },
                          limitRefusal(responder)));
          }}},
        {std::string(method::kStopReportingSessionForID),
         reporterOperation(&MxReportingServiceProtocol::stopReportingSessionForID)},
        {std::string(method::kDestroyReportingSession),
         reporterOperation(&MxReportingServiceProtocol::destroyReportingSession)},
        {std::string(method::kReporterIDValid),
         {1,
          [](auto& service, auto& args, const Responder& responder) {
              auto id = args.reporterID(0);
              if (!args.error())
                  service.reporterID(id, [responder](const Dictionary& validity) { responder->respond(validity); });
          }}},
        {std::string(method::kGetAllReporters),
         {0,
          [](auto& service, auto&, const Responder& responder) {
              service.getAllReporters([responder](std::vector<ReporterID> reporters) {
                  responder->respond(Array(std::vector<Value>(reporters.begin(), reporters.end())));
              });
          }}},
        {std::string(method::kKillService),
         {0,
          [](auto& service, auto&, const Responder& responder) {
              service.killService(boolReply(responder));
          }}},
    };
    return table;
}

} // namespace

MxReportingRequestDispatch::MxReportingRequestDispatch(std::shared_ptr<MxReportingServiceProtocol> service,
                                                       StatusRequest status, std::shared_ptr<BacklogAccount> backlog)
    : service_(std::move(service)), status_(std::move(status)), backlog_(std::move(backlog))
{
}

bool MxReportingRequestDispatch::overdrawn() const { return backlog_ && backlog_->overdrawn(); }

void MxReportingRequestDispatch::whenSettled(UniqueFunction<void()> resume)
{
    if (!backlog_) {
        resume();
        return;
    }
    backlog_->whenSettled(std::move(resume));
}

void MxReportingRequestDispatch::handleRequest(const std::string& method, const Array* params,
                                               std::shared_ptr<ServiceReply> reply)
{
    if (method == method::kStatus) {
        if (!params || !params->empty())
            reply->fail({kServiceErrorBadArguments, "status takes no arguments"});
        else
            status_([reply](Dictionary status) { reply->respond(std::move(status)); });
        return;
    }
    auto operation = operations().find(method);
    if (operation == operations().end()) {
        reply->fail({kServiceErrorUnknownMethod, fmt::format("unknown method {}", method)});
        return;
    }
    if (!params) {
        reply->fail({kServiceErrorBadArguments, fmt::format("parameters of {} must be an array", method)});
        return;
    }
    if (params->size() != operation->second.arity) {
        reply->fail({kServiceErrorBadArguments,
                     fmt::format("{} takes {} arguments, not {}", method, operation->second.arity, params->size())});
        return;
    }
    Arguments arguments(method, *params);
    operation->second.call(*service_, arguments, reply);
    if (arguments.error())
        reply->fail(*arguments.error());
}

} // namespace mx
