#include "client/log_identity.h"

#include "core/log_tools.h"

log_identity log_read_identity()
{
    log_identity identity;
    vex_get_nv_item("integrate_version", identity.version, sizeof identity.version);
    vex_get_nv_item("model_name", identity.model, sizeof identity.model);
    vex_get_nv_item("imei", identity.imei, sizeof identity.imei);
    vex_get_nv_item("modem_msn", identity.msn, sizeof identity.msn);
    return identity;
}
