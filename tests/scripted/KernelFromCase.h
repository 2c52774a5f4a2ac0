// The statements of a case file that make the kernel. What is left out has the records' own defaults.
//
//   kernel uid=501 page-size=16K switch=absent short-ids
//   task 100 server parent=1 flags=0 path=/bin/x tally=24K peak=48K page_table=8K port=8 dirty=7 zombie
//        no-owned-list
//   task 101-122 worker                       several processes alike
//     map start=1M size=64K tag=2 pages=D3C2S1.8 object-pages=... object=7 offset=4K share=4 file=/a/b
//         external=1 purgeable=1 wired         (on one line) one mapping of the task or tasks above
//     map submap=2 size=1M                     the next two lines are what this submap holds
//     map pages-words=9,0*7,16 purgeable-fails=5 raw; a state that cannot be read
//     map pages=D counts=1,1,2,0               resident, dirty, reusable, swapped, told otherwise
//     cache uuid=1 base=0x180000000 size=64K private
//     image /lib base=0x180000000 __TEXT@0x180000000+12K __DATA\sx@0x180003000+1
//     link /lib /usr/lib                       where a path leads
//     owned id=9 virtual=64K resident=16K wired=0 reusable=0 swapped=4K tag=4 purgeable=0 no-tally
//     notice TEXT                             what the platform has to say about it
//     machine-notice TEXT                     ... and about every process of such a machine
//   tag 120 TEXT                              what memory with this tag is for
//   fail CALL ERROR nth=2 times=3 pid=100     as ScriptedKernel::fail; "times=always"
//   ends CALL nth=2 pid=100                   the process ends before that call
//   interrupt CALL nth=2 pid=100              a SIGINT before that call

#pragma once

#include "platform/scripted/ScriptedKernel.h"
#include "scripted/CaseFile.h"

namespace tally {

/// Applies `statements` to `kernel`. Throws std::runtime_error that names the line of a mistake.
void buildKernel(platform::ScriptedKernel& kernel, std::vector<CaseStatement> statements);

} // namespace tally
