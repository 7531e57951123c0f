#pragma once

#include "handlers/components/modem/ModemData.h"

namespace kelvo {

// clang-format off
#define DRIVER_FIELDS(X) \
    X(resume_cnt) X(suspend_cnt) X(suspend_max) X(suspend_min) X(suspend_ave) X(resume_max) \
    X(resume_min) X(resume_ave) X(sys_work_total_time) X(sys_sleep_total_time) X(wakeup_cnt_ipc0) \
    X(wakeup_cnt_ipc1) X(wakeup_cnt_ldrx) X(wakeup_cnt_tdrx) X(wakeup_cnt_g1bbp) \
    X(wakeup_cnt_g2bbp) X(wakeup_cnt_g3bbp) X(wakeup_cnt_w2arm22) X(wakeup_cnt_w2arm2) \
    X(wakeup_cnt_cbbp) X(wakeup_cnt_ipf0) X(wakeup_cnt_dsptimer) X(wakeup_cnt_dsp_stamp_timer) \
    X(wakeup_cnt_osa_timer) X(wakeup_cnt_drx_timer) X(wakeup_time_ipc0) X(wakeup_time_ipc1) \
    X(wakeup_time_ldrx) X(wakeup_time_tdrx) X(wakeup_time_g1bbp) X(wakeup_time_g2bbp) \
    X(wakeup_time_g3bbp) X(wakeup_time_w2arm22) X(wakeup_time_w2arm2) X(wakeup_time_cbbp) \
    X(wakeup_time_ipf0) X(wakeup_time_dsptimer) X(wakeup_time_dsp_stamp_timer) \
    X(wakeup_time_osa_timer) X(wakeup_time_drx_timer) X(wakelock_time_TLPHY) \
    X(wakelock_time_PS_G0) X(wakelock_time_PS_W0) X(wakelock_time_PS_G1) X(wakelock_time_PS_W1) \
    X(wakelock_time_FTM) X(wakelock_time_FTM_1) X(wakelock_time_NAS) X(wakelock_time_NAS_1) \
    X(wakelock_time_OAM) X(wakelock_time_SCI0) X(wakelock_time_SCI1) X(wakelock_time_TLPS) \
    X(wakelock_time_TLPS1) X(wakelock_time_DSFLOW) X(wakelock_time_TEST) X(wakelock_time_UART0) \
    X(wakelock_time_TDS) X(wakelock_time_CDMAUART) X(wakelock_time_USIM) \
    X(wakelock_time_DSPPOWERON) X(wakelock_time_RESET) X(wakelock_time_PS_G2) \
    X(wakelock_time_FTM_2) X(wakelock_time_NAS_2) X(wakelock_time_1X) X(wakelock_time_HRPD) \
    X(wakelock_time_MSP) X(wakelock_time_VOWIFI) X(wakelock_time_RNIC) X(wakelock_time_DEEPSLEEP) \
    X(wakelock_time_RESERVED)
// clang-format on

struct driver_data {
    DRIVER_FIELDS(MODEM_RECORD_FIELD)
};
static_assert(sizeof(driver_data) == 288, "driver_data is 72 uint32 counters");

// The modem driver's sleep, wake-up and wake-lock statistics: stored only,
// without a SIM column.
class DriverData : public ModemData {
public:
    static const table_attribute kTable;

    explicit DriverData(ModemDataOwner* owner);

protected:
    int32_t calcEnergy(const void* record) override;
};

}  // namespace kelvo
