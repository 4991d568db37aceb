# fish completion for kytreceiver.
complete -c kytreceiver -f
complete -c kytreceiver -s h -l help -d 'Print help and exit'
complete -c kytreceiver -l version -d 'Print the version and exit'
complete -c kytreceiver -l config -r -F -d 'The settings'
complete -c kytreceiver -l check-config -d 'Say what is wrong with the settings'
complete -c kytreceiver -l make-streams -d 'Make the streams that are missing'
complete -c kytreceiver -l update-streams -d 'Change those that differ from the settings'
complete -c kytreceiver -l list-spool -d 'Print the posts of the spool'
complete -c kytreceiver -l remove-from-spool -x -d 'Remove a post of the spool for good'
complete -c kytreceiver -l check -x -a 'headers full' -d 'What is looked at of each post'
complete -c kytreceiver -l refuse-with -x -d 'What a post gets that nobody can take'
complete -c kytreceiver -l log-level -x -a 'debug default error' -d 'From which level on lines are logged'
complete -c kytreceiver -l ready-file -r -F -d 'Written when the ports are open'
