# fish completion of heft and its companions: options, their arguments, names and ids of processes, files.

function __heft_pids
    for pid in (string match -r '[0-9]+$' /proc/*)
        printf '%s\t%s\n' $pid (cat /proc/$pid/comm 2>/dev/null)
    end
end
function __heft_processes
    cat /proc/*/comm 2>/dev/null | sort -u
    printf '0\tkernel\nkernel_task\tkernel\n'
    __heft_pids
end
function __heft_words
    count (commandline -opc)
end

for program in heft heft-replay
    set -l after
    test $program = heft-replay; and set after -n 'test (__heft_words) -gt 1'
    complete -c $program $after -a '(__heft_processes)'
    complete -c $program $after -s a -l all -d 'All processes and the kernel (root)'
    complete -c $program $after -s j -l json -rF -d 'Write a JSON document, too'
    complete -c $program $after -s h -l help -d 'Print the usage'
    complete -c $program $after -s t -l targetChildren -d 'Descendants of the targets, too'
    complete -c $program $after -s p -l proc -x -a '(__heft_processes)' -d 'Name or id of processes'
    complete -c $program $after -l pid -x -a '(__heft_pids)' -d 'Id of a process'
    complete -c $program $after -s x -l exclude -x -a '(__heft_processes)' -d 'Leave out processes'
    complete -c $program $after -s s -l skip -d 'Leave out idle-exit clean processes'
    complete -c $program $after -s v -d 'Print every region'
    complete -c $program $after -s f -l format -x -a 'bytes formatted pages' -d 'How sizes are printed'
    complete -c $program $after -l sort -x -a 'dirty swapped clean reclaimable wired regions category' -d 'Sort the tables'
    complete -c $program $after -s w -l wide -d 'All columns, whole paths'
    complete -c $program $after -l swapped -d 'Show the swapped column'
    complete -c $program $after -l wired -d 'Show the wired column'
    complete -c $program $after -l vmObjectDirty -d 'Dirty as memory objects see it'
    complete -c $program $after -l unmapped -d 'Search for memory that nobody maps (root)'
end

for program in heft-record heft-replay
    complete -c $program -n 'test (__heft_words) -eq 1' -s h -l help -d 'Print the usage'
    complete -c $program -n 'test (__heft_words) -eq 1' -l version -d 'Print the version'
end

# The kind of capture and, without an option that follows it, how many words there are.
function __heft_record_at
    set -l words (commandline -opc)
    test (count $words) -gt 1; and test $words[2] = $argv[1]; or return 1
    set -l at (count $words)
    test $at -gt 2; and string match -q -- '--*' $words[3]; and set at (math $at - 1)
    test $at $argv[2] $argv[3]
end
complete -c heft-record -f
complete -c heft-record -n 'test (__heft_words) -eq 1' -a 'machine\t"Capture of the machine" memgraph\t"Capture of a process"'
complete -c heft-record -n '__heft_record_at machine -eq 2' -l anonymize -d 'Made-up names'
complete -c heft-record -n '__heft_record_at machine -eq 2' -F
complete -c heft-record -n '__heft_record_at machine -gt 2' -a '0 (__heft_pids)'
complete -c heft-record -n '__heft_record_at memgraph -eq 2' -l vmObjectDirty -d 'What the memory objects see'
complete -c heft-record -n '__heft_record_at memgraph -eq 2' -a '(__heft_pids)'
complete -c heft-record -n '__heft_record_at memgraph -eq 3' -F

for program in heft-top heft-diff heft-html heft-metrics
    complete -c $program -s h -l help -d 'Print the usage'
    complete -c $program -l version -d 'Print the version'
end
for program in heft-top heft-diff
    complete -c $program -s n -l lines -x -d 'At most so many lines'
    complete -c $program -l fail-above -x -d 'Fail above this size'
    complete -c $program -s j -l json -d 'Write JSON'
end
for program in heft-html heft-metrics
    complete -c $program -s o -l output -rF -d 'Write it there'
end
complete -c heft-top -s b -l by -x -a 'process command user unit container' -d 'What a line is'
complete -c heft-top -s s -l sort -x -a 'heft freed shared swapped reclaimable cgroup change growth processes name' -d 'Sort by'
complete -c heft-top -s w -l watch -x -d 'Read again every so many seconds'
complete -c heft-top -s c -l count -x -d 'End after so many readings'
complete -c heft-diff -s l -l least -x -d 'Leave out smaller changes'
complete -c heft-metrics -s n -l largest -x -d 'Tell so many by name'
