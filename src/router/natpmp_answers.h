// Which NAT-PMP answers are still on their way, and which request they belong to.
#ifndef PELORUS_ROUTER_NATPMP_ANSWERS_H
#define PELORUS_ROUTER_NATPMP_ANSWERS_H

#include <natpmp.h>

#include <vector>

namespace pelorus {

/// What distinguishes the answers to two requests, as far as the library passes it on.
struct NatpmpRequest {
    int type = NATPMP_RESPTYPE_PUBLICADDRESS;  ///< NATPMP_RESPTYPE_...
    int privatePort = 0;                       ///< not used for the public address
    bool isRemoval = false;                    ///< asks for lifetime 0
};

/// True when @p answer, a success, can be the one to @p request.
[[nodiscard]] bool isAnswerTo(const natpmpresp_t& answer, const NatpmpRequest& request);

/// Keeps late answers from being taken for the answer to a later request.
///
/// libnatpmp repeats a request on each timeout, and a slow gateway answers every repetition. An
/// answer that is not read in time would be taken for that to the next request, and every answer
/// from then on for that to the one after it.
class NatpmpAnswers {
public:
    /// Call before @p request is sent. Reads and drops what earlier requests left; once the gateway
    /// has answered anything, waits up to two seconds for answers it still owes.
    void begin(const natpmp_t& client, const NatpmpRequest& request);
    /// Call with the library's @p status when the wait for the answer is over. Keeps errno.
    void end(const natpmp_t& client, int status);

    /// True when @p answer, a success, belongs to an earlier request and not to this one. An
    /// answer that fits neither counts as this one's.
    [[nodiscard]] bool isLate(const natpmpresp_t& answer) const;
    /// Notes that a late answer was dropped.
    void countLate();

private:
    bool drop(int socket);

    NatpmpRequest current;
    std::vector<NatpmpRequest> earlier;  // those with answers still owed
    int owed = 0;                        // answers to everything sent so far
    bool gatewayAnswers = false;
};

}  // namespace pelorus

#endif
